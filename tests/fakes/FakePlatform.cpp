#include "tests/fakes/FakePlatform.hpp"

#include <gtest/gtest.h>

#include <algorithm>
#include <iostream>

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
  for (int count = 0; count < 10'000; ++count) {
    if (!runOne()) return;
  }
  ADD_FAILURE() << "the device does not come to rest";
}

void FakePlatform::advance(platform::Time duration) {
  const platform::Time target = manualClock.time + duration;
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

std::shared_ptr<platform::CloudStore> FakePlatform::makeCloudStore(std::string_view identifier,
                                                                   int typeCode) {
  cloudStoresMade.push_back(std::string(identifier) + " " + std::to_string(typeCode));
  return cloud;
}

std::shared_ptr<platform::ServiceListener> FakePlatform::makeServiceListener(std::string_view serviceName) {
  listeners.push_back(std::make_shared<FakeServiceListener>(serviceName));
  return listeners.back();
}

void FakePlatform::teardown() {
  const platform::PlatformScope scope(*this);
  effects.onMoment = nullptr;
  named.registrations.clear();
  streams.handlers.clear();
  for (const auto& listener : listeners) {
    for (const auto& client : std::exchange(listener->clients, {})) client->end();
  }
  for (const auto& cut : std::exchange(cutSubscriptions, {})) cut();
  const auto dropWork = [this] {
    while (!pool->isEmpty() || !loop.queue->isEmpty() || !delivery->isEmpty()) {
      pool->drop();
      loop.queue->drop();
      delivery->drop();
    }
  };
  dropWork();
  clearSlots();
  dropWork();  // an owner that goes gives back its subscriptions
  listeners.clear();
}

}  // namespace fakes
