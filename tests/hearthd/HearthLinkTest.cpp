// The job's side of the link, against a server that says what hearthd would.
#include "platform/linux/HearthLink.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/epoll.h>
#include <sys/socket.h>

#include <future>
#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/linux/BusServer.hpp"
#include "platform/linux/HearthInterface.hpp"

namespace platform::linux_ {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

using Texts = std::vector<std::string>;

// Work waits until the test runs it.
struct ManualQueue : WorkQueue {
  void async(Work work) override { items.push_back(std::move(work)); }
  void run() {
    for (const Work& work : std::exchange(items, {})) work();
  }
  std::vector<Work> items;
};

// Records calls; answers registrations with the generation that the test gives.
struct Service : BusHandler {
  void call(std::size_t operation, List arguments, BusCompletion completion) override {
    calls.push_back(hearthInterface().operations[operation].name);
    for (const Value& argument : arguments) calls.back() += " " + describe(argument);
    if (hearthInterface().operations[operation].results == "x") {
      unanswered.push_back(std::move(completion));
    } else {
      completion(List());
    }
  }
  void closed() override {}
  Texts calls;
  std::vector<BusCompletion> unanswered;
};

// The loop's thread touches what is here only until it has settled.
struct HearthLinkTest : testing::Test {
  HearthLinkTest() {
    int ends[2];
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends), 0);
    connection = server.adopt(UniqueDescriptor(ends[0]), PeerIdentity(), service);
    watch = loop.watchDescriptor(server.descriptor(), EPOLLIN, [this](std::uint32_t) { server.dispatch(); });
    link = std::make_unique<HearthLink>(loop, UniqueDescriptor(ends[1]), queue, [] {});
    thread = std::thread([this] { loop.run(); });
    link->setHandler("stream", queue,
                     [this](const Dictionary& event) { handled.push_back(describe(event)); });
    EXPECT_THAT(asked(), ElementsAre("InstallHandler stream"));
  }
  ~HearthLinkTest() override {
    link.reset();
    loop.stop();
    thread.join();
  }

  // Returns when both ends, which share the loop, have long had nothing left to say.
  void settle() {
    std::promise<void> done;
    int left = 100;
    const std::function<void()> turn = [&] {
      if (--left > 0) return loop.async(turn);
      done.set_value();
    };
    loop.async(turn);
    done.get_future().wait();
  }
  void emit(HearthSignal signal, List arguments) {
    loop.async([=, this] {
      connection->emit(static_cast<std::size_t>(signal), arguments, describe(Value(arguments)));
    });
    settle();
  }
  void emitEvent(std::int64_t generation) { emit(HearthSignal::event, {"stream", "name", generation}); }
  // What the service was asked since the last time.
  Texts asked() {
    settle();
    return std::exchange(service->calls, {});
  }

  EventLoop loop;
  const std::shared_ptr<Service> service = std::make_shared<Service>();
  BusServer server{hearthInterface()};
  std::shared_ptr<BusConnection> connection;
  EventSource watch;
  const std::shared_ptr<ManualQueue> queue = std::make_shared<ManualQueue>();
  std::unique_ptr<HearthLink> link;
  std::thread thread;
  Texts handled;
};

TEST_F(HearthLinkTest, TakenFollowsTheHandlerAndWhatIsReplacedMeanwhileIsNotHandled) {
  emitEvent(7);
  EXPECT_THAT(asked(), IsEmpty());
  queue->run();
  EXPECT_THAT(handled, ElementsAre("[\"Name\": \"name\"]"));
  EXPECT_THAT(asked(), ElementsAre("Taken stream name 7"));
  emitEvent(0);
  queue->run();
  EXPECT_EQ(handled.size(), 2u);
  EXPECT_THAT(asked(), IsEmpty()) << "by hand";
  emitEvent(8);
  ASSERT_EQ(queue->items.size(), 1u);
  link->setEvent("stream", "name", std::nullopt);
  queue->run();
  EXPECT_EQ(handled.size(), 2u);
  EXPECT_THAT(asked(), ElementsAre("ClearEvent stream name"));
}

TEST_F(HearthLinkTest, GenerationTellsWhatCameDuringARegistration) {
  for (const std::int64_t came : {9, 10}) {
    link->setEvent("stream", "name", Dictionary{{"Date", Date{5}}});
    EXPECT_THAT(asked(), ElementsAre("SetEvent stream name 5"));
    emitEvent(came);
    EXPECT_EQ(queue->items.size(), 0u) << "held until the answer";
    service->unanswered.back()(List{std::int64_t{10}});
    settle();
    queue->run();
    EXPECT_EQ(handled.size(), came == 10 ? 1u : 0u);
  }
}

TEST_F(HearthLinkTest, ACancelledRegistrationIsNotCalledAndUnwatchesOnlyTheLastOfItsName) {
  std::vector<std::int32_t> calls;
  const auto record = [&](std::int32_t token) { calls.push_back(token); };
  std::int32_t first = 0, second = 0;
  for (std::int32_t* token : {&first, &second}) link->registerHandler("n", *token, queue, record);
  for (int count = 0; count < 2; ++count) emit(HearthSignal::notification, {"n"});
  EXPECT_EQ(queue->items.size(), 2u) << "posts merge";
  link->cancel(first);
  EXPECT_THAT(asked(), ElementsAre("Watch n", "Watch n"));
  queue->run();
  EXPECT_THAT(calls, ElementsAre(second));
  link->cancel(second);
  EXPECT_THAT(asked(), ElementsAre("Unwatch n"));
}

}  // namespace
}  // namespace platform::linux_
