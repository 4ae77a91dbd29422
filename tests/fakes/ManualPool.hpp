// Queues that run nothing until the test says so.
#pragma once

#include <cstdint>
#include <deque>
#include <memory>
#include <optional>
#include <random>
#include <utility>

#include "platform/Platform.hpp"
#include "platform/RunLoop.hpp"
#include "platform/WorkQueue.hpp"

namespace fakes {

// Unlike a real pool it has no thread: work runs on that of the test, one item at a time, with the platform
// current; in the order in which it came or, once seeded, in an order drawn from the seed.
class ManualPool : public platform::WorkQueue {
 public:
  explicit ManualPool(platform::Platform& owner_) : owner(owner_) {}

  void async(platform::Work work) override { items.push_back(std::move(work)); }

  void seed(std::uint64_t value) { random.emplace(value); }
  bool isEmpty() const { return items.empty(); }
  std::size_t size() const { return items.size(); }
  // The pool must not be empty.
  void runOne() {
    const std::size_t index =
        random ? std::uniform_int_distribution<std::size_t>(0, items.size() - 1)(*random) : 0;
    const platform::Work work = std::move(items[index]);
    items.erase(items.begin() + static_cast<std::ptrdiff_t>(index));
    const platform::PlatformScope scope(owner);
    work();
  }
  // What is dropped may queue more as it dies.
  void drop() {
    while (!items.empty()) std::exchange(items, {}).clear();
  }

 private:
  platform::Platform& owner;
  std::deque<platform::Work> items;
  std::optional<std::mt19937_64> random;
};

// Unlike a real loop, run() returns when stop() was called or nothing is left to do: a test cannot wait.
class ManualRunLoop : public platform::RunLoop {
 public:
  explicit ManualRunLoop(platform::Platform& owner) : queue(std::make_shared<ManualPool>(owner)) {}

  void run() override {
    ++runs;
    while (!stopped && !queue->isEmpty()) queue->runOne();
  }
  void stop() override { stopped = true; }
  std::shared_ptr<platform::WorkQueue> mainQueue() override { return queue; }

  const std::shared_ptr<ManualPool> queue;
  int runs = 0;
  bool stopped = false;
};

}  // namespace fakes
