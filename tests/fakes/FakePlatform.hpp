// One device made of fakes, moved by hand.
#pragma once

#include <gtest/gtest.h>

#include <algorithm>

#include "tests/fakes/FakeNotifications.hpp"
#include "tests/fakes/FakeService.hpp"
#include "tests/fakes/FakeStores.hpp"

namespace fakes {

// Thrown in place of the process's stop. No std::exception, or a work queue would take it for a fault.
struct Stopped {
  std::string text;
};

// Everything runs on the thread of the test. Any number may live in one process; each is current while its
// own work runs.
class FakePlatform : public platform::Platform {
 public:
  FakePlatform() {
    centre.addObserver(postRecorder, &PostRecorder::record, "com.kestrel.pairwell.cloud.storeChanged",
                       nullptr);
  }
  ~FakePlatform() override { teardown(); }

  // One item of the pool, the main queue or the delivery thread. False if there is none.
  bool runOne() {
    for (ManualPool* queue : {pool.get(), loop.queue.get(), delivery.get()}) {
      if (!queue->isEmpty()) return queue->runOne(), true;
    }
    return false;
  }
  // Everything that is queued and what that queues. Fails the test if that does not end.
  void runAll() {
    int count = 0;
    while (runOne()) ASSERT_LT(++count, 10'000) << "the device does not come to rest";
  }
  // Lets time pass, with a stop at every date on the way at which an alarm comes due.
  void advance(Time duration) {
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

  // Run by teardown() when the handlers are gone: lists that hold their members strongly are emptied here.
  std::vector<std::function<void()>> cutSubscriptions;
  // Handlers, subscriptions, queued work, slots, while the platform is current; the destructor does it too.
  void teardown() {
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

  RunLoop& runLoop() override { return loop; }
  Queues& queues() override { return queueMaker; }
  LogSink& logSink() override { return log; }
  ProcessEnvironment& environment() override { return variables; }
  Clock& clock() override { return manualClock; }
  SystemControl& systemControl() override { return kernel; }
  DeviceProperties& deviceProperties() override { return device; }
  NamedNotifications& namedNotifications() override { return named; }
  NamedNotificationCentre* namedNotificationCentre() override { return &named; }
  NotificationCentre& notificationCentre() override { return centre; }
  std::shared_ptr<UserPreferences> userPreferences() override { return user; }
  std::shared_ptr<CloudStore> makeCloudStore(std::string_view, int) override { return cloud; }
  RadixController& radixController() override { return radix; }
  EventStreams& eventStreams() override { return streams; }
  std::shared_ptr<ServiceListener> makeServiceListener(std::string_view) override {
    return listeners.emplace_back(std::make_shared<FakeServiceListener>());
  }
  void willStop(std::string_view text) override { throw Stopped{std::string(text)}; }

  Effects effects;
  const std::shared_ptr<ManualPool> pool = std::make_shared<ManualPool>(*this);
  const std::shared_ptr<ManualPool> delivery = std::make_shared<ManualPool>(*this);
  ManualRunLoop loop{*this};
  Queues queueMaker{pool};
  FakeLogSink log{effects};
  FakeEnvironment variables;
  ManualClock manualClock;
  FakeSystemControl kernel;
  FakeDeviceProperties device;
  FakeNamedNotifications named{effects, loop.queue};
  NotificationCentre centre;
  const std::shared_ptr<FakeUserPreferences> user =
      std::make_shared<FakeUserPreferences>("user", effects, delivery);
  const std::shared_ptr<FakeCloudStore> cloud = std::make_shared<FakeCloudStore>(effects, delivery, centre);
  FakeRadixController radix{effects};
  FakeEventStreams streams{effects};
  std::vector<std::shared_ptr<FakeServiceListener>> listeners;

 private:
  // Records the one post that the in-process centre carries besides the cloud store's own:
  // com.kestrel.pairwell.…
  struct PostRecorder {
    Effects& effects;
    void record(const Notification& notification) {
      effects.record(Effects::post, "post " + notification.name.substr(21));
    }
  };

  const std::shared_ptr<PostRecorder> postRecorder = std::make_shared<PostRecorder>(PostRecorder{effects});
};

}  // namespace fakes
