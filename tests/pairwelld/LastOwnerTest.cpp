// The last owner of an object goes inside a delivery to it, on each thread and queue where that can happen.
#include "pairwelld/TarnNotificationHelper.hpp"
#include "pairwelld/notifications/TarnNotificationManager.hpp"
#include "pairwelld/service/ConduitListener.hpp"
#include "tests/pairwelld/World.hpp"

namespace pairwell {
namespace {

struct LastOwnerTest : World {
  using Device = LastOwnerTest;
  struct Row {
    const char* name;
    std::function<void(Device&)> deliver;
    // The effect at which the owner goes, in the midst of what makes it.
    std::string at;
  };
  // Each row on a device of its own.
  static void check(const std::function<void(Device&)>& make, const std::vector<Row>& rows) {
    for (const Row& row : rows) {
      SCOPED_TRACE(row.name);
      Device device;
      make(device);
      device.run();
      device.mark();
      device.platform.effects.onMoment = [&] {
        const Calls all = device.effects(~0u);
        const bool isDue = !all.empty() && all.back().find(row.at) != std::string::npos;
        if (isDue && device.release) std::exchange(device.release, nullptr)();
      };
      row.deliver(device);
      device.run();
      EXPECT_FALSE(device.release);
      EXPECT_TRUE(device.watched.expired());
    }
  }
  // `release`, which is dropped when it has run, lets go of every reference but those of a delivery under
  // way.
  void keep(std::weak_ptr<void> object, std::function<void()> release_) {
    watched = std::move(object);
    release = std::move(release_);
  }
  std::shared_ptr<Subscriber> makeCaller() {
    const auto subscriber = makeSubscriber("");
    subscriber->onCall = [this] { effect(); };
    return subscriber;
  }
  void effect() { platform.effects.record(Effects::client, "called"); }

  void switchOff() { platform.cloud->changeFromElsewhere({{flagKey, false}}); }
  void fireAlarm() { platform.streams.deliver("com.kestrel.alarm", {{"Name", flagKey}}); }

 private:
  std::weak_ptr<void> watched;
  std::function<void()> release;
};

TEST_F(LastOwnerTest, OfTheStoreManager) {
  const auto make = [](Device& device) {
    const auto kvs = KeyValueStoreManager::create();
    kvs->activate();
    kvs->subscribe(device.makeCaller());
    device.keep(kvs, [kvs] {});
  };
  check(make, {{"on its queue, with more deliveries behind", &Device::changeCloud, "called"},
               {"on the poster's thread", &Device::changeCloud, "post pairwell.prefsChanged"},
               {"on a global queue", &Device::changeRoot, "Root KVS Notification"}});
}

TEST_F(LastOwnerTest, OfTheObserver) {
  const auto make = [](Device& device) {
    const auto observer = KeyValueStoreCustomObserver::create(
        {overrideKey}, [&device, own = std::make_shared<int>()](KeyValueSource, const auto&) {
          device.effect();
          ++*own;
        });
    observer->start();
    device.keep(observer, [observer] {});
  };
  check(make, {{"on the delivery thread", &Device::changeUser, "called"},
               {"on the poster's thread", &Device::changeCloud, "called"},
               {"on a global queue", &Device::changeRoot, "called"}});
}

TEST_F(LastOwnerTest, OfTheDebugManager) {
  const auto make = [](Device& device) {
    const auto kvs = device.makeManager();
    kvs->activate();
    const auto manager = DebugManager::create(kvs);
    device.platform.cloud->store(flagKey, true);
    manager->activate();
    device.keep(manager, [manager] {
      dropSubscriptions(*manager->kvs);
      letGo(*manager);
    });
  };
  check(make, {{"on main", &Device::fireAlarm, "didReceieve notification"},
               {"on the store manager's queue", &Device::changeUser, "keyValueChanged source"},
               {"on its queue, inside a write", &Device::switchOff, "post cloud.storeChanged"},
               {"on its queue, at its last step", &Device::switchOff, "post pairwell.settingsChanged"}});
}

TEST_F(LastOwnerTest, OfASubscriber) {
  const auto make = [](Device& device) {
    const auto kvs = device.makeManager();
    kvs->activate();
    const auto subscriber = device.makeCaller();
    const auto changes = kvs->subscribe(subscriber);
    const auto alarms = SystemNotificationManager::shared()->subscribe(subscriber);
    device.keep(subscriber, [changes, alarms] {
      changes.unsubscribe([](const auto&) {});
      alarms.unsubscribe([](const auto&) {});
    });
  };
  check(make, {{"on main", &Device::fireAlarm, "called"},
               {"on the store manager's queue", &Device::changeUser, "called"}});
}

TEST_F(LastOwnerTest, OfAHelper) {
  const auto make = [](Device& device) {
    TarnNotificationManager::shared()->setUp();
    const std::weak_ptr helper = TarnNotificationHelper::create({{"a", [&device] { device.effect(); }}});
    device.keep(helper, [helper] { TarnNotificationManager::shared()->unregisterHelper(*helper.lock()); });
  };
  const auto post = [](Device& device) { device.platform.named.postFromElsewhere("a"); };
  const auto match = [](Device& device) {
    device.platform.streams.deliver("com.kestrel.tidingsd.matching", {{"Name", "a"}});
  };
  check(make, {{"on main, from the centre", post, "called"}, {"on main, from the stream", match, "called"}});
}

TEST_F(LastOwnerTest, OfAConnectionAndItsListener) {
  const auto make = [](Device& device) {
    const auto listener = ConduitListener::create();
    listener->activate();
    device.run();
    const auto client = device.offerClient(7);
    // The connection holds its listener, so both go.
    device.keep(listener, [&device, listener, client] {
      device.platform.listeners[0]->clients.clear();
      client->end();
      if (!listener->serialQueue->isCurrent()) listener->serialQueue->sync([] {});
    });
  };
  const auto write = [](Device& device) {
    device.platform.listeners[0]->clients[0]->exportedObject->setKestrelAudioAccessoryLimitedLogging(
        true, [](auto) {});
  };
  const auto offer = [](Device& device) { device.offerClient(8, {}); };
  check(make, {{"on a worker", write, "Enable Kestrel"}, {"on the listener's queue", offer, "denied, 8"}});
}

}  // namespace
}  // namespace pairwell
