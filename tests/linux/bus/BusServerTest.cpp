// Clients that do what they should not, and what the others notice of it: nothing.
#include "platform/linux/BusServer.hpp"

#include <sys/wait.h>

#include <random>

#include "platform/linux/BusClient.hpp"
#include "tests/linux/bus/BusWorld.hpp"

namespace platform::linux_ {
namespace {

using namespace std::chrono_literals;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::Not;

using BusServerTest = World;

TEST_F(BusServerTest, CallsThatDoNotFitGetAnErrorAndNoMore) {
  std::string unended = callMessage("Echo", "text");
  unended.back() = 'x';
  const std::pair<std::string, std::string> rows[] = {
      {callMessage("Missing", ""), "Error.UnknownMethod"},
      {callMessage("Wide", "not a number"), "Error.InvalidArgs"},
      {unended, "Error.InconsistentMessage"},
      {callMessage("Echo", "text"), text("text")},
  };
  Wire wire = client();
  for (const auto& [message, answer] : rows) EXPECT_TRUE(wire.send(message) && wire.reads(answer)) << answer;
  EXPECT_THAT(calls, ElementsAre("text"));
}

TEST_F(BusServerTest, PipelinedCallsAreAnsweredAsTheyAreCompletedThoughTheClientSaysNoMore) {
  constexpr std::uint32_t count = 1000;
  std::string unsent;
  for (std::uint32_t serial = 1; serial <= count; ++serial)
    unsent += callMessage("Hold", std::to_string(serial), serial);
  Wire wire = client();
  std::mt19937 random(7);
  std::vector<std::string> completed;
  while (completed.size() < count) {
    if (const ssize_t sent = wire.sendSome(unsent); sent > 0) unsent.erase(0, static_cast<std::size_t>(sent));
    if (unsent.empty()) ::shutdown(wire.socket.get(), SHUT_WR);
    ASSERT_TRUE(waitFor([&] { return !held.empty(); }));
    EXPECT_LE(held.size(), limits::outstanding);
    const std::size_t index = random() % held.size();
    completed.push_back(held[index].text);
    complete(index);
    wire.receive();
  }
  for (const std::string& call : completed)
    EXPECT_TRUE(wire.reads(answerTo(static_cast<std::uint32_t>(std::stoul(call)))) && wire.reads(text(call)));
  EXPECT_EQ(wire.readToEnd(), "");
  EXPECT_EQ(closed, 1);
}

TEST_F(BusServerTest, TheLastCallOfAClientThatHasGoneIsHandled) {
  // A process that is gone before it is even admitted.
  decides = false;
  const std::string large(10'000, 'x');  // two are more than is read in one turn
  const std::string ahead =
      std::string(handshakeAhead) + callMessage("Hold", large) + callMessage("Echo", large);
  const pid_t child = ::fork();
  if (child == 0) ::_exit(Wire(path).send(ahead) ? 0 : 1);
  ASSERT_TRUE(waitFor([&] { return undecided.size() == 1; }));
  int status = -1;
  ::waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
  undecided.front()(admission());
  EXPECT_TRUE(waitFor([&] { return closed == 1; }));
  EXPECT_EQ(calls.size(), 2u);
}

TEST_F(BusServerTest, EveryClientThatIsRefusedIsToldSo) {
  const std::size_t before = openDescriptors();
  const std::string refused = "REJECTED EXTERNAL\r\nREJECTED EXTERNAL\r\nREJECTED EXTERNAL\r\n";
  decides = false;
  // Decided before the client speaks or after it, who speaks in one piece or by the byte, and reads before or
  // after that.
  for (unsigned count = 0; count < 800; ++count) {
    const bool isDecidedFirst = count % 2 == 0, readsFirst = count % 4 == 0;
    const std::size_t piece = count % 8 < 4 ? handshakeAhead.size() : 1;
    Wire wire = connect();
    const auto refuse = [&] {
      ASSERT_TRUE(waitFor([&] { return !undecided.empty(); }));
      std::exchange(undecided, {})[0]({});
    };
    if (isDecidedFirst) refuse();
    std::string told = readsFirst ? wire.readToEnd() : "";
    for (std::size_t at = 0; at < handshakeAhead.size(); at += piece)
      ASSERT_TRUE(wire.send(handshakeAhead.substr(at, piece))) << "a broken pipe is no refusal";
    if (!isDecidedFirst) refuse();
    if (!readsFirst) told = wire.readToEnd();
    ASSERT_EQ(told, refused) << count;
  }
  EXPECT_TRUE(waitFor([&] { return openDescriptors() == before; }));
}

TEST_F(BusServerTest, DrainingWaitsForTheAnswersThatAreLeft) {
  Wire wire = client();
  ASSERT_TRUE(wire.send(callMessage("Hold", "answer")));
  ASSERT_TRUE(waitFor([&] { return held.size() == 1; }));
  Wire idle = client();
  const Wire shaking = connect();
  turn();
  bool drained = false;
  server->drain([&] { drained = true; });
  turn();
  EXPECT_FALSE(drained);
  complete(0);
  EXPECT_TRUE(wire.reads(text("answer")));
  EXPECT_TRUE(waitFor([&] { return drained; }));
  EXPECT_EQ(closed, 1) << "of the one that was still in its handshake";
}

TEST_F(BusServerTest, UnreadSignalsMergeByKeyAndKeepTheirOrder) {
  Wire wire = client();
  constexpr std::size_t count = 2000, size = 1024;
  for (std::size_t index = 0; index < count; ++index)
    connections[0]->emit(0, {std::string(size, '.')}, "same");
  connections[0]->emit(1, {"x"}, "other");
  connections[0]->emit(0, {"kept apart"}, "other");
  connections[0]->emit(1, {"y"}, "other");
  connections[0]->emit(0, {"newest"}, "same");
  // Room for what the library holds, too little for the poll to tell: the call's turn takes it along.
  char some[16384];
  ASSERT_EQ(::recv(wire.socket.get(), some, sizeof some, MSG_WAITALL), ssize_t{sizeof some});
  wire.received.assign(some, sizeof some);
  ASSERT_TRUE(wire.send(callMessage("Echo", "and a call")));
  for (const std::string& part :
       {text("newest"), text("Other"), text("y"), text("Changed"), text("kept apart")})
    ASSERT_TRUE(wire.reads(part)) << part;
  EXPECT_THAT(wire.received, Not(HasSubstr(text("x"))));
  EXPECT_LT(wire.received.size(), count / 2 * size);
}

TEST_F(BusServerTest, WhatComesTooLateIsHarmless) {
  Wire gone = client();
  ASSERT_TRUE(gone.send(callMessage("Hold", "")));
  ASSERT_TRUE(waitFor([&] { return held.size() == 1; }));
  gone.socket.reset();
  // Finds the end by writing, outside dispatch(); the handler lets go of the connection.
  connections[0]->emit(0, {"nobody"}, "");
  EXPECT_FALSE(connections.empty());
  EXPECT_TRUE(waitFor([&] { return closed == 1; }));
  complete(0);

  const Callee bus{"/org/freedesktop/DBus", "org.freedesktop.DBus", ""};
  Wire hasty = client();
  ASSERT_TRUE(hasty.send(callMessage("Hello", "", 1, bus) + callMessage("Hello", "", 2, bus)));
  hasty.socket.reset();
  EXPECT_TRUE(waitFor([&] { return closed == 2; })) << "the library has closed it behind the first answer";

  decides = false;
  const Wire waiting = connect();
  ASSERT_TRUE(waitFor([&] { return undecided.size() == 1; }));
  decides = true;
  Wire last = client();
  ASSERT_TRUE(last.send(callMessage("Hold", "")));
  ASSERT_TRUE(waitFor([&] { return held.size() == 1; }));
  decides = false;
  const Wire undecidedToTheEnd = connect();
  ASSERT_TRUE(waitFor([&] { return undecided.size() == 2; }));
  server->drain([] {});
  undecided[0](admission());
  EXPECT_TRUE(waitFor([&] { return closed == 3; })) << "of the client that draining closed";
  server.reset();
  EXPECT_EQ(closed, 4);
  complete(0);
  undecided[1](admission());
  EXPECT_EQ(last.readToEnd(), "");
}

TEST_F(BusServerTest, NothingWakesAServerThatNoLongerListens) {
  server->stopListening();
  const Wire wire = connect();  // the service manager's socket takes it
  turn();
  EXPECT_FALSE(isAwake());
}

TEST(BusClientTest, AServiceThatHangsCostsAClientItsTimeoutAndNoMore) {
  const TemporaryFolder folder;
  const UniqueDescriptor nobodyAccepts = listenAt(folder.path + "/hanging");
  EXPECT_EQ(BusClient::connect(folder.path + "/hanging", 50ms).error(), Outcome::timedOut);
  EXPECT_EQ(BusClient::connect(folder.path + "/none", deadline).error(), Outcome::notConnected);
}

// Without patience.
struct HastyBusServerTest : World {
  HastyBusServerTest() : World({200ms, 200ms, 200ms, 200ms}) {}
};

TEST_F(HastyBusServerTest, WhoeverStallsIsDisconnected) {
  int ends[2];
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends), 0);
  PeerIdentity job;
  job.uid = ::geteuid();
  const auto adopted = server->adopt(UniqueDescriptor(ends[0]), job, admission().handler);
  Wire idle = client();
  Wire waiting = client();
  ASSERT_TRUE(waiting.send(callMessage("Hold", "answer")));
  EXPECT_EQ(connect().readToEnd(), "") << "silent in the handshake";
  Wire halting = client();
  const std::string message = callMessage("Echo", std::string(2000, 'x'));
  // A byte now and then does not help.
  for (std::size_t sent = 0; halting.send(message.substr(sent, 1));) {
    ASSERT_LT(++sent, message.size());
    std::this_thread::sleep_for(10ms);
  }
  decides = false;
  Wire refused = connect();
  ASSERT_TRUE(waitFor([&] { return undecided.size() == 1; }));
  undecided[0]({});
  EXPECT_TRUE(eventually([&] { return !refused.send("x"); })) << "refused, but never closed";
  // Clients that wait are others' fault, or nobody's.
  complete(0);
  EXPECT_TRUE(waiting.reads(text("answer")));
  EXPECT_TRUE(idle.isServed());
  Wire late = connect();
  late.socket = UniqueDescriptor(ends[1]);
  late.shakeHands();
  EXPECT_TRUE(late.isServed()) << "adopted: it takes its time";
}

}  // namespace
}  // namespace platform::linux_
