#include "platform/WorkQueue.hpp"

#include <gtest/gtest.h>

#include <atomic>
#include <deque>
#include <stdexcept>
#include <thread>

#include "platform/linux/ThreadPool.hpp"

namespace platform {
namespace {

using linux_::ThreadPool;

struct HeldPool : WorkQueue {
  void async(Work work) override { jobs.push_back(std::move(work)); }
  void runOne() {
    Work job = std::move(jobs.front());
    jobs.pop_front();
    job();
  }
  std::deque<Work> jobs;
};

TEST(SerialQueueTest, APoolThreadIsReturnedAfterItsTurn) {
  auto pool = std::make_shared<HeldPool>();
  const auto queue = Queues(pool).serial("q", QueueRank::state);
  int ran = 0;
  for (int i = 0; i < 100; ++i) queue->async([&] { ++ran; });
  ASSERT_EQ(pool->jobs.size(), 1u);
  pool->runOne();
  EXPECT_EQ(ran, 64);
  ASSERT_EQ(pool->jobs.size(), 1u);
  pool->runOne();
  EXPECT_EQ(ran, 100);
}

TEST(SerialQueueTest, TheLastReferenceMayGoInsideAnItem) {
  auto pool = std::make_shared<HeldPool>();
  auto queue = Queues(pool).serial("q", QueueRank::state);
  const std::weak_ptr<SerialQueue> weak = queue;
  queue->async([held = std::move(queue)] { EXPECT_TRUE(held->isCurrent()); });
  pool->runOne();
  EXPECT_TRUE(weak.expired());
}

TEST(SerialQueueDeathTest, StopsWhereItWouldDeadlock) {
  testing::FLAGS_gtest_death_test_style = "threadsafe";
  Queues queues(std::make_shared<HeldPool>());
  const auto low = queues.serial("low", QueueRank::delivery);
  const auto high = queues.serial("high", QueueRank::state);
  const auto peer = queues.serial("peer", QueueRank::state);
  EXPECT_DEATH(low->sync([&] { low->sync([] {}); }), "sync on low from itself");
  EXPECT_DEATH(low->sync([&] { high->sync([&] { low->sync([] {}); }); }), "sync on low from itself");
  EXPECT_DEATH(high->sync([&] { peer->sync([] {}); }), "sync on peer from high: a queue of no lower rank");
  EXPECT_DEATH(low->sync([] { throw std::runtime_error("an escaped text"); }), "an escaped text");
  EXPECT_DEATH(high->assertCurrent(), "not on high");
}

// Writers, readers and nested hops at once; what each caller did stays in its own order, and nothing is lost.
class SerialQueueStress : public testing::TestWithParam<int> {};

TEST_P(SerialQueueStress, KeepsOrderAndLosesNothing) {
  constexpr int callers = 4, rounds = 3000;
  std::vector<int> last(callers, -1);
  long total = 0, inner = 0;
  std::atomic<int> nested = 0;
  {
    auto pool = std::make_shared<ThreadPool>(static_cast<std::size_t>(GetParam()));
    Queues queues(pool);
    const auto outer = queues.serial("outer", QueueRank::delivery);
    const auto state = queues.serial("state", QueueRank::state);
    const auto leaf = queues.serial("leaf", QueueRank::list);
    std::vector<std::thread> threads;
    for (int& own : last) {
      threads.emplace_back([&] {
        for (int round = 0; round < rounds; ++round) {
          state->async([&, round] {
            EXPECT_EQ(std::exchange(own, round), round - 1);
            ++total;
            leaf->sync([&] { ++inner; });
          });
          if (round % 3 == 0) state->sync([&] { EXPECT_EQ(own, round); });
          if (round % 5 == 0) outer->async([&] { state->sync([&] { leaf->sync([&] { ++nested; }); }); });
          // Readers that live in the pool itself, as client operations do.
          if (round % 7 == 0) queues.workers()->async([&] { state->sync([&] { ++nested; }); });
        }
      });
    }
    for (auto& thread : threads) thread.join();
    // The pool alone ends the queues: its destructor runs what is left.
    EXPECT_TRUE(pool->waitUntilIdle(std::chrono::steady_clock::now() + std::chrono::seconds(60)));
  }
  EXPECT_EQ(total, callers * rounds);
  EXPECT_EQ(inner, callers * rounds);
  EXPECT_EQ(nested, callers * ((rounds + 4) / 5 + (rounds + 6) / 7));
}

INSTANTIATE_TEST_SUITE_P(Pools, SerialQueueStress, testing::Values(1, 2, 8));

}  // namespace
}  // namespace platform
