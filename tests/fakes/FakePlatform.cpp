#include "tests/fakes/FakePlatform.hpp"

#include <gtest/gtest.h>

#include <algorithm>

namespace fakes {

FakePlatform::FakePlatform() {
  centre.addObserver(postRecorder, &PostRecorder::record, "com.kestrel.pairwell.cloud.storeChanged", nullptr);
}

FakePlatform::~FakePlatform() { teardown(); }

void FakePlatform::seed(std::uint64_t value) {
  testing::Test::RecordProperty("seed", std::to_string(value));
  random.emplace(value);
  pool->seed(value);
}

bool FakePlatform::runOne() {
  std::vector<ManualPool*> ready;
  for (ManualPool* queue : {pool.get(), loop.queue.get(), delivery.get()}) {
    if (!queue->isEmpty()) ready.push_back(queue);
  }
  if (ready.empty()) return false;
  const std::size_t turn =
      random ? std::uniform_int_distribution<std::size_t>(0, ready.size() - 1)(*random) : 0;
  ready[turn]->runOne();
  return true;
}

void FakePlatform::runAll() {
  int count = 0;
  while (runOne()) ASSERT_LT(++count, 10'000) << "the device does not come to rest";
}

void FakePlatform::advance(Time duration) {
  const Time target = manualClock.time + duration;
  runAll();
  while (const auto due = streams.nextDue()) {
    if (*due > target) break;
    manualClock.time = std::max(manualClock.time, *due);
    streams.deliverDue(manualClock.time);
    runAll();
  }
  manualClock.time = target;
  runAll();
}

void FakePlatform::teardown() {
  const PlatformScope scope(*this);
  effects.onMoment = nullptr;
  named.registrations.clear();
  streams.handlers.clear();
  for (const auto& listener : listeners) {
    for (const auto& client : std::exchange(listener->clients, {})) client->end();
  }
  for (const auto& cut : std::exchange(cutSubscriptions, {})) cut();
  const auto dropWork = [this] {
    while (!pool->isEmpty() || !loop.queue->isEmpty() || !delivery->isEmpty()) {
      for (const auto& queue : {pool, loop.queue, delivery}) queue->drop();
    }
  };
  dropWork();
  clearSlots();
  dropWork();  // an owner that goes gives back its subscriptions
  listeners.clear();
}

}  // namespace fakes
