// Clients that do what they should not, and what the others notice of it: nothing.
#include "platform/linux/BusServer.hpp"

#include <gmock/gmock.h>
#include <poll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/wait.h>

#include <cerrno>
#include <future>
#include <random>

#include "platform/LogSink.hpp"
#include "platform/linux/BusClient.hpp"
#include "tests/linux/bus/BusWorld.hpp"

namespace platform::linux_ {
namespace {

using namespace std::chrono_literals;
using testing::ElementsAre;
using testing::HasSubstr;

constexpr std::size_t mebibyte = 1024 * 1024;

// How often a server said that it accepts nobody for a while.
struct RestsLog : LogSink {
  RestsLog() { installLogSink(*this); }
  bool enabled(const LogChannel&, LogLevel) override { return true; }
  void write(const LogChannel&, LogLevel, std::string_view format, std::span<const LogArgument>) override {
    if (format.find("accepting rests") != format.npos) ++rests;
  }
  std::atomic<int> rests = 0;
} log;

struct BusServerTest : World {
  BusServerTest() { EXPECT_EQ(::getrlimit(RLIMIT_NOFILE, &original), 0); }
  ~BusServerTest() override { EXPECT_EQ(limitDescriptors(original.rlim_cur), 0); }
  int limitDescriptors(rlim_t count) const {
    const rlimit limit{count, original.rlim_max};
    return ::setrlimit(RLIMIT_NOFILE, &limit);
  }
  rlimit original{};
};

TEST_F(BusServerTest, CallsThatDoNotFitGetAnErrorAndNoMore) {
  std::string unended = callMessage("Echo", "text");
  unended.back() = 'x';
  const std::string error = "org.freedesktop.DBus.Error.";
  const std::pair<std::string, std::string> rows[] = {
      {callMessage("Missing", ""), error + "UnknownMethod"},
      {callMessage("Echo", "", {.interface = "test.Other"}), error + "UnknownMethod"},
      {callMessage("Echo", "", {.path = "/other"}), error + "UnknownObject"},
      {callMessage("Wide", "not a number"), error + "InvalidArgs"},
      {unended, error + "InconsistentMessage"},
      {callMessage("GetNameOwner", "x.y",
                   {.path = "/org/freedesktop/DBus", .interface = "org.freedesktop.DBus"}),
       ""},
      {callMessage("Echo", "text"), ""},
  };
  Wire wire = client();
  for (const auto& [message, name] : rows) {
    ASSERT_TRUE(wire.send(message));
    const auto answer = wire.next();
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->name, name);
  }
  auto library = BusClient::connect(path, deadline);
  ASSERT_TRUE(library);
  const BusInterface introspectable{
      "/test", "org.freedesktop.DBus.Introspectable", {{"Introspect", "", "s"}}, {}};
  const auto description = (*library)->call(introspectable, "Introspect", {}, deadline);
  ASSERT_TRUE(description);
  EXPECT_THAT(describe(std::get<List>(*description).front()), HasSubstr("<method name=\"Hold\">"));
  EXPECT_THAT(calls, ElementsAre("text"));

  ASSERT_TRUE(wire.send(callMessage("Echo", "", {.flags = noReplyExpected}) +
                        callMessage("Missing", "", {.flags = noReplyExpected}) +
                        callMessage("Echo", "", {.serial = 3})));
  EXPECT_EQ(wire.next()->serial, 3u) << "only calls that expect an answer get one";
}

TEST_F(BusServerTest, DamageEndsItsClientAloneAndHoldsNoMemory) {
  const std::string good = callMessage("Echo", "good");
  const auto damaged = [&](std::size_t at, char byte) {
    std::string message = good;
    message[at] = byte;
    return message;
  };
  std::string giant = good.substr(0, 16);
  giant[7] = 0x07;  // a body of 120 MiB
  giant[6] = static_cast<char>(0x80);
  const std::pair<const char*, std::string> rows[] = {
      {"giant", giant},
      {"version 2", damaged(3, 2)},
      {"damaged, then giant", damaged(17, 9) + giant},
      {"no byte order", damaged(0, 'x')},
      {"serial 0", damaged(8, 0)},
      {"type 0", damaged(1, 0)},
      {"descriptors that are not there", damaged(16, 9)},
  };
  Wire witness = client();
  const std::size_t before = residentBytes();
  int ended = 0;
  for (const auto& [name, bytes] : rows) {
    SCOPED_TRACE(name);
    Wire wire = client();
    std::size_t sent = bytes.size();
    // Until the server has had enough; what is not damaged in itself it would go on reading.
    for (bool taken = wire.send(bytes + good); taken && sent < 8 * mebibyte; sent += 4096)
      taken = wire.send(std::string(4096, '\0'));
    EXPECT_LT(sent, mebibyte);  // what sockets hold, mostly
    EXPECT_EQ(wire.readToEnd(), "");
    EXPECT_TRUE(waitFor([&, expected = ++ended] { return closed == expected; }));
    EXPECT_TRUE(witness.isServed());
  }
  EXPECT_LT(residentBytes(), before + 4 * mebibyte);
  EXPECT_THAT(calls, testing::Not(testing::Contains("good")));
}

TEST_F(BusServerTest, PipelinedCallsAreAnsweredAsTheyAreCompletedThoughTheClientSaysNoMore) {
  constexpr std::size_t count = 1000;
  Wire wire = client();
  const auto writing = std::async(std::launch::async, [&] {
    for (std::uint32_t serial = 1; serial <= count; ++serial)
      wire.send(callMessage("Hold", std::to_string(serial), {.serial = serial}));
    wire.closeOutput();
  });
  std::vector<std::string> completed, answered;
  const auto worker = std::async(std::launch::async, [&] {
    std::mt19937 random(7);
    while (completed.size() < count && waitFor([&] { return !held.empty(); })) {
      std::unique_lock lock(mutex);
      EXPECT_LE(held.size(), limits::outstanding);
      const std::size_t index = random() % held.size();
      completed.push_back(held[index].text);
      lock.unlock();
      complete(index);
    }
  });
  while (const auto answer = wire.next()) {
    EXPECT_EQ(std::to_string(answer->serial), answer->text);
    answered.push_back(answer->text);
  }
  worker.wait();
  EXPECT_EQ(answered.size(), count);
  EXPECT_EQ(answered, completed);
  EXPECT_TRUE(waitFor([&] { return closed == 1; }));
}

TEST_F(BusServerTest, TheLastCallOfAClientThatHasGoneIsHandled) {
  Wire wire = client();
  ASSERT_TRUE(wire.send(callMessage("Echo", "from here", {.flags = noReplyExpected}) +
                        callMessage("Echo", "and another", {.flags = noReplyExpected})));
  wire.close();
  EXPECT_TRUE(waitFor([&] { return calls.size() == 2 && closed == 1; }));

  // Another process, which is gone before it is even admitted.
  decides = false;
  const std::string ahead =
      std::string(handshakeAhead) + callMessage("Echo", "from a child", {.flags = noReplyExpected});
  const pid_t child = ::fork();
  if (child == 0) ::_exit(Wire(path).send(ahead) ? 0 : 1);
  int status = -1;
  ASSERT_TRUE(waitFor([&] { return undecided.size() == 1; }));
  // Decided in the turn of the loop in which its end is known already, or before.
  onLoop([&] {
    ::waitpid(child, &status, 0);
    undecided.front()(admission());
  });
  EXPECT_EQ(status, 0);
  EXPECT_TRUE(waitFor([&] { return closed == 2; }));
  EXPECT_THAT(calls, ElementsAre("from here", "and another", "from a child"));
}

TEST_F(BusServerTest, UnreadSignalsMergeByKeyAndKeepTheirOrder) {
  Wire wire = client();
  constexpr int count = 2000;
  onLoop([&] {
    const std::string padding(1024, '.');
    for (int index = 0; index < count; ++index)
      connections[0]->emit(0, {std::to_string(index) + padding}, "same");
    connections[0]->emit(1, {"x"}, "other");
    connections[0]->emit(0, {"kept apart"}, "other");
    connections[0]->emit(1, {"y"}, "other");
    connections[0]->emit(0, {"newest"}, "same");
  });
  std::vector<std::string> read{"", "", ""};
  while (read.back() != "Changed kept apart") {
    const auto signal = wire.next();
    ASSERT_TRUE(signal);
    read.push_back(signal->name + " " + signal->text);
  }
  EXPECT_LT(read.size(), count / 2);
  EXPECT_THAT(std::vector(read.end() - 3, read.end()),
              ElementsAre("Changed newest", "Other y", "Changed kept apart"));
}

TEST_F(BusServerTest, WhatComesTooLateIsHarmless) {
  Wire gone = client();
  ASSERT_TRUE(gone.send(callMessage("Hold", "")));
  ASSERT_TRUE(waitFor([&] { return held.size() == 1; }));
  onLoop([&] {
    gone.close();
    // Finds the end by writing, outside dispatch(); the handler lets go of the connection.
    connections[0]->emit(0, {"nobody"}, "");
    EXPECT_FALSE(connections.empty());
  });
  EXPECT_TRUE(waitFor([&] { return closed == 1; }));
  complete(0);

  decides = false;
  const pid_t child = ::fork();
  if (child == 0) ::_exit(Wire(path).descriptor() < 0);
  ASSERT_TRUE(waitFor([&] { return undecided.size() == 1; }));
  ::waitpid(child, nullptr, 0);
  const Wire waiting(path);
  ASSERT_TRUE(waitFor([&] { return undecided.size() == 2; }));
  onLoop([&] { undecided[0](admission()); });
  EXPECT_TRUE(waitFor([&] { return closed == 2; })) << "of the client that had gone";

  decides = true;
  Wire last = client();
  ASSERT_TRUE(last.send(callMessage("Hold", "")));
  ASSERT_TRUE(waitFor([&] { return held.size() == 1; }));
  decides = false;
  const Wire undecidedToTheEnd(path);
  ASSERT_TRUE(waitFor([&] { return undecided.size() == 3; }));
  onLoop([&] { server->drain([] {}); });
  undecided[1](admission());
  EXPECT_TRUE(waitFor([&] { return closed == 3; })) << "of the client that draining closed";
  endServer();
  EXPECT_EQ(closed, 4);
  complete(0);
  undecided[2](admission());
  EXPECT_EQ(last.readToEnd(), "");
}

TEST_F(BusServerTest, NothingWakesAServerThatNoLongerListens) {
  onLoop([&] {
    server->stopListening();
    const Wire wire(path);  // the service manager's socket takes it
    server->dispatch();
    pollfd entry{server->descriptor(), POLLIN, 0};
    EXPECT_EQ(::poll(&entry, 1, 0), 0);
  });
}

TEST_F(BusServerTest, AtTheDescriptorLimitClientsWaitUntilOthersEnd) {
  constexpr std::size_t clients = 30;
  std::vector<Wire> wires;
  const int before = log.rests;
  ASSERT_EQ(limitDescriptors(openDescriptors() + clients + limits::spareDescriptors + 20), 0);
  while (wires.size() < clients) wires.emplace_back(path);
  EXPECT_TRUE(eventually([&] { return log.rests > before; }));
  // Each one that ends lets the next one in.
  for (Wire& wire : wires) {
    wire.shakeHands();
    EXPECT_TRUE(wire.isServed());
    wire.close();
  }
}

TEST_F(BusServerTest, OneUsersConnectionsAreLimitedAndOneThatEndsMakesRoom) {
  if (original.rlim_max < 4 * limits::connectionsPerUser) GTEST_SKIP() << "takes more descriptors";
  ASSERT_EQ(limitDescriptors(original.rlim_max), 0);
  Wire first = client();
  decides = false;
  std::vector<Wire> wires;
  while (wires.size() < limits::connectionsPerUser - 1) wires.emplace_back(path);
  EXPECT_EQ(Wire(path).readToEnd(), "");
  EXPECT_TRUE(first.isServed());
  first.close();
  ASSERT_TRUE(waitFor([&] { return closed == 1; }));
  decides = true;
  EXPECT_TRUE(client().isServed());
}

// Without patience.
struct HastyBusServerTest : World {
  HastyBusServerTest() : World({200ms, 200ms, 200ms, 200ms}) {}
};

TEST_F(HastyBusServerTest, WhoeverStallsIsDisconnected) {
  Wire idle = client();
  Wire waiting = client();
  ASSERT_TRUE(waiting.send(callMessage("Hold", "")));
  Wire silent(path);
  EXPECT_TRUE(silent.waitForHangUp()) << "in the handshake";
  Wire halting = client();
  const std::string message = callMessage("Echo", std::string(2000, 'x'));
  std::size_t sent = 0;
  // A byte now and then does not help.
  while (halting.send(message.substr(sent, 1))) {
    ASSERT_LT(++sent, message.size());
    pollfd entry{halting.descriptor(), 0, 0};
    ::poll(&entry, 1, 10);
  }
  decides = false;
  Wire refused(path);
  ASSERT_TRUE(waitFor([&] { return undecided.size() == 1; }));
  undecided[0]({});
  EXPECT_TRUE(refused.waitForHangUp()) << "refused, but never closed";
  // Clients that wait are others' fault, or nobody's.
  complete(0);
  EXPECT_EQ(waiting.next()->name, "");
  EXPECT_TRUE(idle.isServed());
}

TEST_F(HastyBusServerTest, AFloodThatIsNeverReadIsBoundedAndEnds) {
  Wire witness = client();
  Wire flood = client();
  const std::size_t before = residentBytes();
  const std::string message = callMessage("Echo", std::string(4096, 'x'));
  std::size_t sent = 0;
  bool blocked = false;
  for (;;) {
    ASSERT_LT(sent, 64 * mebibyte);
    const ssize_t count = ::send(flood.descriptor(), message.data() + sent % message.size(),
                                 message.size() - sent % message.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
    if (count >= 0) {
      sent += static_cast<std::size_t>(count);
    } else if (errno == EAGAIN) {
      blocked = true;
      EXPECT_TRUE(witness.isServed());
      pollfd entry{flood.descriptor(), POLLOUT, 0};
      ASSERT_EQ(::poll(&entry, 1, 20'000), 1);
    } else {
      break;  // disconnected
    }
  }
  EXPECT_TRUE(blocked) << "reading never stopped";
  EXPECT_LT(sent, 2 * mebibyte);
  EXPECT_LT(residentBytes(), before + 4 * mebibyte);
  EXPECT_TRUE(witness.isServed());
}

}  // namespace
}  // namespace platform::linux_
