// A server on a thread of its own, and clients that write what they like.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/linux/BusServer.hpp"
#include "platform/linux/EventLoop.hpp"
#include "tests/fakes/RealFiles.hpp"

namespace platform::linux_ {

using fakes::deadline;
using fakes::eventually;
using fakes::TemporaryFolder;
inline constexpr std::chrono::hours never{1};

struct CallOptions {
  std::string path = "/test";
  std::string interface = "test.Interface";
  std::uint8_t flags = 0;
  std::uint32_t serial = 1;
};
inline constexpr std::uint8_t noReplyExpected = 1;

// A client's whole handshake, as libraries send it ahead.
inline constexpr std::string_view handshakeAhead{"\0AUTH EXTERNAL\r\nDATA\r\nBEGIN\r\n", 29};

// A method call with a text as its argument, written by hand: libraries refuse to make bad ones.
std::string callMessage(const std::string& member, const std::string& text, const CallOptions& options = {});

// What came back: a return, which has no name, an error or a signal.
struct Answer {
  std::uint32_t serial = 0;  // of the call
  std::string name;
  std::string text;  // the first result
};

// A client's end. Reads give up at the deadline, which fails the test.
class Wire {
 public:
  explicit Wire(const std::string& path);
  int descriptor() const { return socket.get(); }
  // False once the server has closed.
  bool send(std::string_view bytes);
  // Sends the handshake ahead, and waits to be let in.
  void shakeHands();
  std::optional<Answer> next();  // absent at the end
  std::string readToEnd();
  bool waitForHangUp();  // both directions closed
  void close() { socket.reset(); }
  void closeOutput();
  // Whether a call is answered.
  bool isServed();

 private:
  bool fill(std::size_t size);

  UniqueDescriptor socket;
  std::string received;
};

UniqueDescriptor listenAt(const std::string& path);
std::size_t openDescriptors();
std::size_t residentBytes();

// Operations: Echo answers at once, Hold when the test says so, Wide takes a t. Every client is admitted,
// unless the test decides.
struct World : testing::Test {
  explicit World(limits::Patience patience = {never, never, never, never});
  ~World() override;

  // On the loop's thread; waits for it.
  void onLoop(const std::function<void()>& work);
  bool waitFor(const std::function<bool()>& condition);  // is asked with `mutex` held
  Wire client();                                         // admitted, and through the handshake
  void complete(std::size_t index);                      // the held call of that index, with its text
  BusServer::Admission admission();
  void endServer();

  struct Held {
    std::string text;
    BusCompletion completion;
  };
  class Handler;

  TemporaryFolder folder;
  const std::string path = folder.path + "/socket";
  UniqueDescriptor hearthsOwn;  // as a service manager keeps the socket of its job

  std::mutex mutex;  // guards everything below, up to the loop
  std::condition_variable changed;
  std::vector<std::string> calls;
  std::vector<Held> held;
  std::vector<BusServer::Decide> undecided;
  std::atomic<bool> decides = true;
  int closed = 0;

  EventLoop loop;
  std::vector<std::shared_ptr<BusConnection>> connections;  // the loop's thread's, in order of admission
  std::unique_ptr<BusServer> server;
  EventSource watch;
  std::thread thread;
};

}  // namespace platform::linux_
