// A client that costs as little as can be, alike for ours and the peers: its calls are made up beforehand,
// and of what comes it looks at the kind alone.
#pragma once

#include <cstddef>
#include <string>

#include "platform/Value.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

namespace bench {

// Where calls go.
struct Service {
  std::string socket;
  std::string destination;  // on a bus; empty without one
  std::string path, interface;
  bool isBare = false;  // neither handshake nor format: it answers so many bytes with a reply
};

// A method call; arguments are texts, integers and booleans.
std::string callMessage(const Service& service, const std::string& member,
                        const platform::List& arguments = {});
// A broadcast.
std::string signalMessage(const Service& service, const std::string& member);
// A method's reply without contents, to whatever has the serial of callMessage().
std::string replyMessage();

class Client {
 public:
  enum class Kind : char { reply = 2, signal = 4 };

  // Connects and authenticates; on a bus says Hello, too.
  explicit Client(const Service& service);

  int descriptor() const { return socket.get(); }
  void send(const std::string& message) const;
  // What one read brings, waiting for it if nothing is there: how many of that kind. An error ends the
  // benchmark.
  std::size_t receive(Kind kind);
  // Sends, and waits for the answer.
  void call(const std::string& message);

 private:
  const platform::linux_::UniqueDescriptor socket;
  std::string pending;
};

// Connects and calls until an answer comes.
void awaitAnswer(const Service& service, const std::string& operation);

}  // namespace bench
