// The last owner of an object goes inside a delivery to it.
#include "pairwelld/TarnNotificationHelper.hpp"
#include "pairwelld/notifications/TarnNotificationManager.hpp"
#include "tests/pairwelld/World.hpp"

namespace pairwell {
namespace {

struct LastOwnerTest : World {
  // `release` lets go of every reference but those of a delivery under way: at the first effect of that text,
  // in the midst of what makes it.
  void expectGone(const std::weak_ptr<void>& object, std::function<void()> release, const std::string& at,
                  const std::function<void()>& deliver) {
    SCOPED_TRACE(at);
    run();
    mark();
    platform.effects.onMoment = [&] {
      const Calls all = effects(~0u);
      const bool isDue = release && !all.empty() && all.back().find(at) != std::string::npos;
      if (isDue) std::exchange(release, nullptr)();
    };
    deliver();
    run();
    platform.effects.onMoment = nullptr;
    EXPECT_FALSE(release);
    EXPECT_TRUE(object.expired());
  }
  void called() { platform.effects.record(Effects::client, "called"); }
};

TEST_F(LastOwnerTest, OfTheStoreManager) {
  // On its queue with more deliveries behind, on the poster's thread, on a global queue.
  const std::pair<const char*, void (World::*)()> rows[] = {
      {"called", &World::changeCloud},
      {"post pairwell.prefsChanged", &World::changeUser},
      {"Root KVS Notification", &World::changeRoot}};
  for (const auto& [at, change] : rows) {
    auto kvs = KeyValueStoreManager::create();
    kvs->activate();
    const auto subscriber = makeSubscriber("");
    subscriber->onCall = [this] { called(); };
    kvs->subscribe(subscriber);
    expectGone(
        kvs, [&] { kvs.reset(); }, at, [this, change = change] { (this->*change)(); });
  }
}

TEST_F(LastOwnerTest, OfTheObserver) {
  for (const auto change : {&World::changeUser, &World::changeCloud, &World::changeRoot}) {
    // What a callback holds is there until it returns.
    auto observer = KeyValueStoreCustomObserver::create(
        {overrideKey}, [this, own = std::make_shared<int>()](KeyValueSource, const auto&) {
          called();
          ++*own;
        });
    observer->start();
    expectGone(
        observer, [&] { observer.reset(); }, "called", [this, change] { (this->*change)(); });
  }
}

TEST_F(LastOwnerTest, OfTheDebugManagerInsideAWrite) {
  const auto kvs = makeManager();
  kvs->activate();
  platform.cloud->store(flagKey, true);
  auto manager = DebugManager::create(kvs);
  manager->activate();
  const auto release = [&] {
    dropSubscriptions(*kvs);
    letGo(*manager);
    manager.reset();
  };
  expectGone(manager, release, "post cloud.storeChanged", [this] {
    platform.cloud->changeFromElsewhere({{flagKey, false}});
  });
}

TEST_F(LastOwnerTest, OfAHelperOnEitherRoute) {
  TarnNotificationManager::shared()->setUp();
  for (const bool isStream : {false, true}) {
    const std::weak_ptr helper = TarnNotificationHelper::create({{"a", [this, own = std::make_shared<int>()] {
                                                                    called();
                                                                    ++*own;
                                                                  }}});
    const auto release = [&] { TarnNotificationManager::shared()->unregisterHelper(*helper.lock()); };
    expectGone(helper, release, "called", [&] {
      if (!isStream) return platform.named.postFromElsewhere("a");
      platform.streams.deliver("com.kestrel.tidingsd.matching", {{"Name", "a"}});
    });
  }
}

}  // namespace
}  // namespace pairwell
