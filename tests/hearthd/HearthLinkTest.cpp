// The job's side of the link, against a server that says what hearthd would.
#include "platform/linux/HearthLink.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/epoll.h>
#include <sys/socket.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <future>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/LogSink.hpp"
#include "platform/linux/BusServer.hpp"
#include "platform/linux/HearthInterface.hpp"

namespace platform::linux_ {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

constexpr std::chrono::seconds patience{10};

// Work waits until the test runs it.
class ManualQueue : public WorkQueue {
 public:
  void async(Work work) override {
    std::lock_guard lock(mutex);
    items.push_back(std::move(work));
    added.notify_all();
  }
  bool waitFor(std::size_t count) {
    std::unique_lock lock(mutex);
    return added.wait_for(lock, patience, [&] { return items.size() >= count; });
  }
  std::size_t size() {
    std::lock_guard lock(mutex);
    return items.size();
  }
  void run() {
    std::vector<Work> batch;
    {
      std::lock_guard lock(mutex);
      batch.swap(items);
    }
    for (const Work& work : batch) work();
  }

 private:
  std::mutex mutex;
  std::condition_variable added;
  std::vector<Work> items;
};

class RecordingLog : public LogSink {
 public:
  bool enabled(const LogChannel&, LogLevel) override { return true; }
  void write(const LogChannel&, LogLevel, std::string_view format,
             std::span<const LogArgument> arguments) override {
    std::lock_guard lock(mutex);
    lines.push_back(formatLogMessage(format, arguments, false));
  }
  std::mutex mutex;
  std::vector<std::string> lines;
};

// Records calls; answers registrations with the generation that the test gave, once it has given one.
class Service : public BusHandler {
 public:
  void call(std::size_t operation, List arguments, BusCompletion completion) override {
    std::lock_guard lock(mutex);
    std::string text = hearthInterface().operations[operation].name;
    for (const Value& argument : arguments) text += " " + describe(argument);
    calls.push_back(text);
    if (hearthInterface().operations[operation].results == "x") {
      unanswered.push_back(std::move(completion));
    } else {
      completion(List());
    }
    changed.notify_all();
  }
  void closed() override {}

  bool waitFor(const std::string& call) {
    std::unique_lock lock(mutex);
    return changed.wait_for(lock, patience, [&] { return !calls.empty() && calls.back() == call; });
  }
  void answer(std::int64_t generation) {
    std::lock_guard lock(mutex);
    for (const BusCompletion& completion : unanswered) completion(List{generation});
    unanswered.clear();
  }
  std::vector<std::string> seen() {
    std::lock_guard lock(mutex);
    return calls;
  }

 private:
  std::mutex mutex;
  std::condition_variable changed;
  std::vector<std::string> calls;
  std::vector<BusCompletion> unanswered;
};

class HearthLinkTest : public testing::Test {
 protected:
  HearthLinkTest() {
    int ends[2];
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends), 0);
    connection = server.adopt(UniqueDescriptor(ends[0]), PeerIdentity(), service);
    watch = loop.watchDescriptor(server.descriptor(), EPOLLIN, [this](std::uint32_t) { server.dispatch(); });
    link = std::make_unique<HearthLink>(loop, UniqueDescriptor(ends[1]), queue, [this] { ++lost; });
    thread = std::thread([this] { loop.run(); });
  }
  ~HearthLinkTest() override {
    link.reset();
    loop.stop();
    thread.join();
  }

  void emit(HearthSignal signal, List arguments) {
    const std::string key = describe(Value(arguments));
    loop.async([this, signal, arguments, key] {
      connection->emit(static_cast<std::size_t>(signal), arguments, key);
    });
  }
  void emitEvent(std::int64_t generation) { emit(HearthSignal::event, {"stream", "name", generation}); }
  // Posts have an answer, so everything that hearthd sent before has been read when a later one is seen to be
  // handled by the loop.
  void settle() {
    static int count = 0;
    const std::string name = "settle" + std::to_string(++count);
    std::int32_t token;
    auto settled = std::make_shared<ManualQueue>();
    link->registerHandler(name, token, settled, [](std::int32_t) {});
    ASSERT_TRUE(service->waitFor("Watch " + name));
    emit(HearthSignal::notification, {name});
    ASSERT_TRUE(settled->waitFor(1));
    settled->run();
  }
  void installHandler() {
    link->setHandler("stream", queue,
                     [this](const Dictionary& event) { handled.push_back(describe(event)); });
    ASSERT_TRUE(service->waitFor("InstallHandler stream"));
  }

  EventLoop loop;
  std::shared_ptr<Service> service = std::make_shared<Service>();
  BusServer server{hearthInterface()};
  std::shared_ptr<BusConnection> connection;
  EventSource watch;
  std::shared_ptr<ManualQueue> queue = std::make_shared<ManualQueue>();
  std::atomic<int> lost = 0;
  std::unique_ptr<HearthLink> link;
  std::thread thread;
  std::vector<std::string> handled;
};

TEST_F(HearthLinkTest, TakenLeavesAfterTheHandlerHasReturned) {
  installHandler();
  emitEvent(7);
  ASSERT_TRUE(queue->waitFor(1));
  settle();
  EXPECT_THAT(service->seen(), testing::Not(testing::Contains("Taken stream name 7")));
  queue->run();
  EXPECT_THAT(handled, ElementsAre("[\"Name\": \"name\"]"));
  EXPECT_TRUE(service->waitFor("Taken stream name 7"));

  emitEvent(0);
  ASSERT_TRUE(queue->waitFor(1));
  queue->run();
  settle();
  EXPECT_EQ(handled.size(), 2u);
  EXPECT_THAT(service->seen(), testing::Not(testing::Contains("Taken stream name 0")));
}

TEST_F(HearthLinkTest, EventReplacedWhileItWaitsIsNotHandled) {
  installHandler();
  emitEvent(1);
  ASSERT_TRUE(queue->waitFor(1));
  link->setEvent("stream", "name", std::nullopt);
  queue->run();
  EXPECT_THAT(handled, IsEmpty());
  EXPECT_TRUE(service->waitFor("ClearEvent stream name"));
}

TEST_F(HearthLinkTest, GenerationTellsWhatCameDuringARegistration) {
  for (const bool fresh : {false, true}) {
    handled.clear();
    installHandler();
    link->setEvent("stream", "name", Dictionary{{"Date", Date{5}}});
    ASSERT_TRUE(service->waitFor("SetEvent stream name 5"));
    const std::int64_t generation = fresh ? 20 : 10;
    emitEvent(fresh ? generation : generation - 1);
    settle();
    EXPECT_EQ(queue->size(), 0u) << "held until the answer";
    service->answer(generation);
    settle();
    queue->run();
    EXPECT_EQ(handled.size(), fresh ? 1u : 0u);
  }
}

TEST_F(HearthLinkTest, DescriptorWithoutADateIsLoggedAndNotSent) {
  static RecordingLog log;  // stays installed for the life of the process
  installLogSink(log);
  for (const Dictionary& descriptor :
       {Dictionary(), Dictionary{{"Date", 5}}, Dictionary{{"date", Date{5}}}}) {
    link->setEvent("stream", "name", descriptor);
  }
  settle();
  EXPECT_THAT(service->seen(), testing::Each(testing::Not(HasSubstr("SetEvent"))));
  std::lock_guard lock(log.mutex);
  EXPECT_EQ(log.lines.size(), 3u);
  EXPECT_THAT(log.lines, testing::Each(HasSubstr("event name of stream refused: no usable date")));
}

TEST_F(HearthLinkTest, PostsMergeUntilHandledAndStopAfterCancel) {
  std::vector<std::int32_t> calls;
  const auto record = [&](std::int32_t token) { calls.push_back(token); };
  std::int32_t first = 0;
  std::int32_t second = 0;
  EXPECT_EQ(link->registerHandler("n", first, queue, record), 0u);
  EXPECT_EQ(link->registerHandler("n", second, queue, record), 0u);
  EXPECT_NE(first, second);
  for (int count = 0; count < 3; ++count) {
    emit(HearthSignal::notification, {"n"});
    settle();
  }
  EXPECT_EQ(queue->size(), 2u);
  queue->run();
  EXPECT_THAT(calls, ElementsAre(first, second));

  link->cancel(first);
  emit(HearthSignal::notification, {"n"});
  settle();
  EXPECT_THAT(service->seen(), testing::Not(testing::Contains("Unwatch n")));
  const auto elsewhere = std::make_shared<ManualQueue>();
  std::int32_t third = 0;
  EXPECT_EQ(link->registerHandler("n", third, elsewhere, record), 0u);
  emit(HearthSignal::notification, {"n"});
  settle();
  link->cancel(second);
  link->cancel(third);
  queue->run();
  EXPECT_EQ(calls.size(), 2u) << "on the main queue a cancelled one is done with";
  elsewhere->run();
  EXPECT_EQ(calls.back(), third) << "elsewhere a queued call still comes";
  EXPECT_TRUE(service->waitFor("Unwatch n"));
}

struct Observer {
  int calls = 0;
};

TEST_F(HearthLinkTest, ObserversAreCalledWhileTheyLiveAndAreAdded) {
  const auto callback = [](const std::shared_ptr<void>& observer, const std::optional<std::string>& name) {
    EXPECT_EQ(name, "n");
    ++std::static_pointer_cast<Observer>(observer)->calls;
  };
  auto dies = std::make_shared<Observer>();
  const auto removed = std::make_shared<Observer>();
  const auto stays = std::make_shared<Observer>();
  for (const auto& observer : {dies, removed, stays}) link->addObserver(observer, callback, "n");
  emit(HearthSignal::notification, {"n"});
  ASSERT_TRUE(queue->waitFor(3));
  link->removeObserver(removed.get(), "n");
  link->removeObserver(stays.get(), "another");
  dies.reset();
  queue->run();
  EXPECT_EQ(removed->calls, 0);
  EXPECT_EQ(stays->calls, 1);
}

TEST_F(HearthLinkTest, EndOfTheLinkIsToldOnce) {
  settle();
  loop.async([this] { connection->close(); });
  for (const auto end = std::chrono::steady_clock::now() + patience;
       lost == 0 && std::chrono::steady_clock::now() < end;) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  link->post("n");
  auto flushed = std::make_shared<std::promise<void>>();
  loop.async([flushed] { flushed->set_value(); });
  flushed->get_future().wait();
  EXPECT_EQ(lost, 1);
}

}  // namespace
}  // namespace platform::linux_
