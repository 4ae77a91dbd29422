// A server that has its turns while the test waits, and clients that write what they like.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>

#include <bit>
#include <cerrno>

#include "platform/linux/BusServer.hpp"
#include "tests/fakes/BusMessage.hpp"
#include "tests/fakes/RealFiles.hpp"

namespace platform::linux_ {

using fakes::deadline;
using fakes::eventually;
using fakes::handshakeAhead;
using fakes::number;
using fakes::TemporaryFolder;
using fakes::text;
inline constexpr std::chrono::hours never{1};
inline std::string answerTo(std::uint32_t serial) { return std::string("\5\1u\0", 4) + number(serial); }

// What a call is of: an object's interface, and the types of its arguments; and how its numbers stand.
struct Callee {
  std::string path = "/test", interface = "test.Interface", signature = "s";
  std::endian order = std::endian::native;
};
// A method call with a text as its argument, with none, or with several as they stand in a message; written
// by hand: libraries refuse to make bad ones.
inline std::string callMessage(const std::string& member, const std::string& argument,
                               std::uint32_t serial = 1, const Callee& callee = {}) {
  std::string fields;
  fakes::addField(fields, 1, 'o', text(callee.path, callee.order));
  fakes::addField(fields, 2, 's', text(callee.interface, callee.order));
  fakes::addField(fields, 3, 's', text(member, callee.order));
  fakes::addField(fields, 8, 'g', fakes::signature(callee.signature));
  const std::size_t arguments = callee.signature.size();
  const std::string body = arguments == 0 ? "" : arguments > 1 ? argument : text(argument, callee.order);
  return fakes::busMessage(1, fields, body, serial, callee.order);
}

// A client's end. `meanwhile` runs while it waits, which fails the test at the deadline.
struct Wire {
  explicit Wire(
      const std::string& path, std::function<void()> meanwhile_ = [] {})
      : socket(fakes::socketAt(path, ::connect)), meanwhile(std::move(meanwhile_)) {}

  ssize_t sendSome(std::string_view bytes) {
    return ::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
  }
  // False once the server has closed.
  bool send(std::string_view bytes) {
    bool open = true;
    EXPECT_TRUE(eventually([&] {
      meanwhile();
      const ssize_t sent = sendSome(bytes);
      open = sent >= 0 || errno == EAGAIN;
      if (sent > 0) bytes.remove_prefix(static_cast<std::size_t>(sent));
      return bytes.empty() || !open;
    })) << "nothing is taken";
    return open;
  }
  void receive() {
    char buffer[16384];
    ssize_t count;
    while ((count = ::recv(socket.get(), buffer, sizeof buffer, MSG_DONTWAIT)) > 0)
      received.append(buffer, static_cast<std::size_t>(count));
    ended = count == 0 || errno != EAGAIN;
  }
  // Whether `wanted` comes, behind what was read before.
  bool reads(std::string_view wanted) {
    std::size_t at = received.npos;
    EXPECT_TRUE(eventually([&] {
      meanwhile();
      receive();
      at = received.find(wanted, used);
      return at != received.npos || ended;
    })) << "nothing comes";
    if (at != received.npos) used = at + wanted.size();
    return at != received.npos;
  }
  std::string readToEnd() {
    EXPECT_FALSE(reads("what never comes"));
    return received.substr(used);
  }
  // Sends the handshake ahead, and waits to be let in.
  void shakeHands() {
    EXPECT_TRUE(send(handshakeAhead));
    EXPECT_TRUE(reads("OK ") && reads("\r\n"));
  }
  // Whether a call is answered.
  bool isServed() { return send(callMessage("Echo", "served?")) && reads(text("served?")); }

  UniqueDescriptor socket;
  std::function<void()> meanwhile;
  std::string received;
  std::size_t used = 0;
  bool ended = false;
};

inline UniqueDescriptor listenAt(const std::string& path) {
  UniqueDescriptor socket = fakes::socketAt(path, ::bind);
  EXPECT_EQ(::listen(socket.get(), 128), 0);
  return socket;
}
inline std::size_t openDescriptors() {
  return static_cast<std::size_t>(std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {}));
}

// Operations: Echo answers at once, Hold when the test says so, Wide takes a t. Every client is admitted,
// unless the test decides. All on the test's thread.
struct World : testing::Test {
  explicit World(limits::Patience patience = {never, never, never, never}) {
    const BusInterface served{"/test",
                              "test.Interface",
                              {{"Echo", "s", "s"}, {"Hold", "s", "s"}, {"Wide", "t", ""}},
                              {{"Changed", "s"}, {"Other", "s"}}};
    server = std::make_unique<BusServer>(served, patience);
    server->listen(UniqueDescriptor(::dup(hearthsOwn.get())), [this](PeerIdentity, BusServer::Decide decide) {
      if (decides) return decide(admission());
      undecided.push_back(std::move(decide));
    });
  }

  bool isAwake() const {
    pollfd entry{server->descriptor(), POLLIN, 0};
    return ::poll(&entry, 1, 0) == 1;
  }
  void turn() {
    if (server && isAwake()) server->dispatch();
  }
  bool waitFor(const std::function<bool()>& condition) {
    return eventually([&] { return turn(), condition(); });
  }
  Wire connect() {
    return Wire(path, [this] { turn(); });
  }
  // Admitted, and through the handshake.
  Wire client() {
    Wire wire = connect();
    wire.shakeHands();
    return wire;
  }
  // The held call of that index, with its text.
  void complete(std::size_t index) {
    const Held call = held.at(index);
    held.erase(held.begin() + static_cast<std::ptrdiff_t>(index));
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
      const auto argument = *arguments.front().as<std::string>();
      world.calls.push_back(argument);
      if (operation == 0) completion(std::move(arguments));
      if (operation == 1) world.held.push_back({argument, std::move(completion)});
    }
    void closed() override {
      if (connection) std::erase(world.connections, std::exchange(connection, nullptr));
      ++world.closed;
    }
    std::shared_ptr<BusConnection> connection;
    World& world;
  };

  struct Held {
    std::string text;
    BusCompletion completion;
  };
  TemporaryFolder folder;
  const std::string path = folder.path + "/socket";
  const UniqueDescriptor hearthsOwn = listenAt(path);  // as a service manager keeps the socket of its job
  std::vector<std::string> calls;
  std::vector<Held> held;
  std::vector<BusServer::Decide> undecided;
  bool decides = true;
  int closed = 0;
  std::vector<std::shared_ptr<BusConnection>> connections;  // in order of admission
  std::unique_ptr<BusServer> server;
};

}  // namespace platform::linux_
