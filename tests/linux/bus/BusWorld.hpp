// A server on a thread of its own, and clients that write what they like.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/epoll.h>

#include <atomic>
#include <condition_variable>
#include <cstring>
#include <future>
#include <mutex>
#include <optional>

#include "platform/linux/BusServer.hpp"
#include "platform/linux/EventLoop.hpp"
#include "tests/fakes/RealFiles.hpp"

namespace platform::linux_ {

using fakes::deadline;
using fakes::eventually;
using fakes::TemporaryFolder;
inline constexpr std::chrono::hours never{1};
inline constexpr std::uint8_t noReplyExpected = 1;
// A client's whole handshake, as libraries send it ahead.
inline constexpr std::string_view handshakeAhead{"\0AUTH EXTERNAL\r\nDATA\r\nBEGIN\r\n", 29};

inline std::string number(std::uint32_t value) {
  std::string bytes(4, '\0');
  std::memcpy(bytes.data(), &value, 4);
  return bytes;
}
inline std::uint32_t numberAt(const std::string& bytes, std::size_t at) {
  std::uint32_t value;
  std::memcpy(&value, bytes.data() + at, 4);
  return value;
}
inline std::size_t aligned(std::size_t at, std::size_t size) { return (at + size - 1) / size * size; }
inline std::string text(const std::string& value) {
  return number(static_cast<std::uint32_t>(value.size())) + value + '\0';
}

struct CallOptions {
  std::string path = "/test";
  std::string interface = "test.Interface";
  std::uint8_t flags = 0;
  std::uint32_t serial = 1;
};

// A method call with a text as its argument, written by hand: libraries refuse to make bad ones.
inline std::string callMessage(const std::string& member, const std::string& argument,
                               const CallOptions& options = {}) {
  std::string fields;
  const auto add = [&](char code, char type, const std::string& value) {
    fields.resize(aligned(fields.size(), 8));
    fields += std::string{code, 1, type, 0} + value;
  };
  add(1, 'o', text(options.path));
  add(2, 's', text(options.interface));
  add(3, 's', text(member));
  add(8, 'g', std::string("\1s\0", 3));
  const std::string body = text(argument);
  std::string message{'l', 1, static_cast<char>(options.flags), 1};
  message += number(static_cast<std::uint32_t>(body.size())) + number(options.serial) +
             number(static_cast<std::uint32_t>(fields.size())) + fields;
  message.resize(aligned(message.size(), 8));
  return message + body;
}

// What came back: a return, which has no name, an error or a signal.
struct Answer {
  std::uint32_t serial = 0;  // of the call
  std::string name;
  std::string text;  // the first result
};

// A client's end. Reads give up at the deadline, which fails the test.
class Wire {
 public:
  explicit Wire(const std::string& path) : socket(fakes::socketAt(path, ::connect)) {
    const timeval limit{deadline.count(), 0};
    EXPECT_EQ(::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit), 0);
  }
  int descriptor() const { return socket.get(); }
  void close() { socket.reset(); }
  void closeOutput() { ::shutdown(socket.get(), SHUT_WR); }
  // False once the server has closed.
  bool send(std::string_view bytes) {
    while (!bytes.empty()) {
      const ssize_t sent = ::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
      if (sent < 0) return false;
      bytes.remove_prefix(static_cast<std::size_t>(sent));
    }
    return true;
  }
  // Sends the handshake ahead, and waits to be let in.
  void shakeHands() {
    EXPECT_TRUE(send(handshakeAhead));
    std::size_t end;
    while ((end = received.find("OK ")) == received.npos ||
           (end = received.find("\r\n", end)) == received.npos)
      ASSERT_TRUE(fill(received.size() + 1));
    received.erase(0, end + 2);
  }
  // Absent at the end.
  std::optional<Answer> next() {
    if (!fill(16)) return std::nullopt;
    const std::size_t end = 16 + numberAt(received, 12);
    const std::size_t body = aligned(end, 8);
    const std::size_t size = body + numberAt(received, 4);
    if (!fill(size)) return std::nullopt;
    Answer answer;
    for (std::size_t at = 16; at < end;) {
      at = aligned(at, 8);
      const char code = received[at], type = received[at + 2];
      at += 4;
      if (type == 'g') {
        if (received[at + 1] == 's') answer.text = received.substr(body + 4, numberAt(received, body));
        at += 2u + static_cast<unsigned char>(received[at]);
        continue;
      }
      const std::uint32_t value = numberAt(received, at);
      at += 4;
      if (code == 5) answer.serial = value;
      if (code == 3 || code == 4) answer.name = received.substr(at, value);
      if (type != 'u') at += value + 1;
    }
    received.erase(0, size);
    return answer;
  }
  std::string readToEnd() {
    while (fill(received.size() + 1)) {
    }
    return std::exchange(received, "");
  }
  // Until both directions are closed.
  bool waitForHangUp() {
    pollfd entry{socket.get(), 0, 0};
    return ::poll(&entry, 1, static_cast<int>(std::chrono::milliseconds(deadline).count())) == 1;
  }
  // Whether a call is answered.
  bool isServed() {
    if (!send(callMessage("Echo", "served?"))) return false;
    const auto answer = next();
    return answer && answer->text == "served?";
  }

 private:
  // Whether at least `size` bytes are there.
  bool fill(std::size_t size) {
    char buffer[4096];
    while (received.size() < size) {
      const ssize_t count = ::recv(socket.get(), buffer, sizeof buffer, 0);
      EXPECT_FALSE(count < 0 && errno == EAGAIN) << "nothing comes";
      if (count <= 0) return false;
      received.append(buffer, static_cast<std::size_t>(count));
    }
    return true;
  }

  UniqueDescriptor socket;
  std::string received;
};

inline UniqueDescriptor listenAt(const std::string& path) {
  UniqueDescriptor socket = fakes::socketAt(path, ::bind);
  EXPECT_EQ(::listen(socket.get(), 128), 0);
  return socket;
}
inline std::size_t openDescriptors() {
  return static_cast<std::size_t>(std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {}));
}
inline std::size_t residentBytes() {
  std::size_t total = 0, resident = 0;
  std::ifstream("/proc/self/statm") >> total >> resident;
  return resident * 4096;
}

// Operations: Echo answers at once, Hold when the test says so, Wide takes a t. Every client is admitted,
// unless the test decides.
struct World : testing::Test {
  explicit World(limits::Patience patience = {never, never, never, never}) : hearthsOwn(listenAt(path)) {
    const BusInterface served{"/test",
                              "test.Interface",
                              {{"Echo", "s", "s"}, {"Hold", "s", "s"}, {"Wide", "t", ""}},
                              {{"Changed", "s"}, {"Other", "s"}}};
    server = std::make_unique<BusServer>(served, patience);
    server->listen(UniqueDescriptor(::dup(hearthsOwn.get())), [this](PeerIdentity, BusServer::Decide decide) {
      std::lock_guard lock(mutex);
      if (decides) return decide(admission());
      undecided.push_back(std::move(decide));
      changed.notify_all();
    });
    watch =
        loop.watchDescriptor(server->descriptor(), EPOLLIN, [this](std::uint32_t) { server->dispatch(); });
    thread = std::thread([this] { loop.run(); });
  }
  ~World() override {
    endServer();
    loop.stop();
    thread.join();
  }
  void endServer() {
    onLoop([this] {
      watch = EventSource();
      server.reset();
    });
  }

  // On the loop's thread; waits for it.
  void onLoop(const std::function<void()>& work) {
    std::promise<void> done;
    loop.async([&] {
      work();
      done.set_value();
    });
    done.get_future().wait();
  }
  // `condition` is asked with `mutex` held.
  bool waitFor(const std::function<bool()>& condition) {
    std::unique_lock lock(mutex);
    return changed.wait_for(lock, deadline, condition);
  }
  // Admitted, and through the handshake.
  Wire client() {
    Wire wire(path);
    wire.shakeHands();
    return wire;
  }
  // The held call of that index, with its text.
  void complete(std::size_t index) {
    std::unique_lock lock(mutex);
    const Held call = held.at(index);
    held.erase(held.begin() + static_cast<std::ptrdiff_t>(index));
    lock.unlock();
    call.completion(List{call.text});
  }
  BusServer::Admission admission() {
    const auto handler = std::make_shared<Handler>(*this);
    return {handler, [this, handler](std::shared_ptr<BusConnection> connection) {
              handler->connection = connection;
              connections.push_back(std::move(connection));
            }};
  }

  struct Handler : BusHandler {
    explicit Handler(World& world_) : world(world_) {}
    void call(std::size_t operation, List arguments, BusCompletion completion) override {
      const auto* argument = arguments.front().as<std::string>();
      std::lock_guard lock(world.mutex);
      world.calls.push_back(argument ? *argument : "");
      if (operation == 0) completion(std::move(arguments));
      if (operation == 1) world.held.push_back({*argument, std::move(completion)});
      if (operation == 2) completion(List());
      world.changed.notify_all();
    }
    void closed() override {
      if (connection) std::erase(world.connections, std::exchange(connection, nullptr));
      std::lock_guard lock(world.mutex);
      ++world.closed;
      world.changed.notify_all();
    }
    std::shared_ptr<BusConnection> connection;  // the loop's thread's
    World& world;
  };

  struct Held {
    std::string text;
    BusCompletion completion;
  };
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
