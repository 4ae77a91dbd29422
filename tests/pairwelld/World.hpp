// Everything outside the object under test: one device of fakes, current for the length of a test.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "pairwelld/PairwellDaemon.hpp"
#include "pairwelld/debug/DebugManager.hpp"
#include "pairwelld/notifications/SystemNotificationManager.hpp"
#include "pairwelld/settings/KeyValueStoreManager.hpp"
#include "platform/RawValue.hpp"
#include "tests/fakes/FakePlatform.hpp"

namespace pairwell {

using Calls = std::vector<std::string>;
using fakes::Effects;
using platform::Value;
using testing::ElementsAre;
using testing::IsEmpty;

inline constexpr const char* flagKey = "VelaLogCloudCollectionEnabled";
inline constexpr const char* endKey = "VelaLogCloudCollectionEnabledExpiration";
inline constexpr const char* overrideKey = "VelaLogCloudCollectionExpirationIntervalOverride";

// Publisher and subscriber hold each other; this cuts it.
template <class Publisher>
void dropSubscriptions(Publisher& publisher) PW_NO_ANALYSIS {
  auto dropped = std::exchange(publisher.subscriptions, {});
}

// Of either publisher: says who was called with what.
struct Subscriber : KeyValueStoreManagerSubscribing, SystemNotificationManagerSubscribing {
  Subscriber(std::string label_, Calls& calls_) : label(std::move(label_)), calls(calls_) {}
  void keyValueChanged(KeyValueSource source, const std::vector<std::string>& keys) override {
    called(platform::rawValue(source), keys.empty() ? "-" : keys.size() == 1 ? keys[0] : "many");
  }
  void didReceiveNotification(SystemNotificationSource source, std::string_view name) override {
    called(platform::rawValue(source), name);
  }
  void called(std::string_view source, std::string_view what) {
    calls.push_back(label + " " + std::string(source) + " " + Effects::shortKey(what));
    if (const auto call = onCall) call();  // it may replace itself
  }
  const std::string label;
  Calls& calls;
  std::function<void()> onCall;
};

// Also a device of its own within a test.
struct World : testing::Test {
  void TestBody() override {}
  World() { platform.variables.variables["CONDUIT_SERVICE_NAME"] = "com.kestrel.pairwell.conduit"; }

  Calls effects(unsigned kinds) const { return platform.effects.sinceMark(kinds); }
  Calls log() const { return effects(Effects::log); }
  void mark() { platform.effects.mark(); }
  void run() { platform.runAll(); }
  void changeUser() { platform.user->changeFromElsewhere(overrideKey, 60); }
  void changeRoot() { platform.named.postFromElsewhere("com.kestrel.bluetooth.prefsChanged"); }
  void changeCloud() { platform.cloud->changeFromElsewhere({{"other", 1}, {"another", 2}}); }
  // A client comes to the newest listener.
  std::shared_ptr<fakes::FakeClientConnection> offerClient(std::int32_t process,
                                                           platform::Dictionary entitlements = {
                                                               {"com.kestrel.bluetooth.system", true}}) {
    auto client =
        std::make_shared<fakes::FakeClientConnection>(platform.effects, process, std::move(entitlements));
    platform.listeners.back()->offer(client);
    run();
    return client;
  }
  double now() { return platform.manualClock.time.count(); }

  std::shared_ptr<Subscriber> makeSubscriber(const char* label) {
    return std::make_shared<Subscriber>(label, calls);
  }
  std::shared_ptr<KeyValueStoreManager> makeManager() {
    auto kvs = KeyValueStoreManager::create();
    platform.cutSubscriptions.push_back([kvs] { dropSubscriptions(*kvs); });
    return kvs;
  }
  // Nothing has run on its queue yet.
  std::shared_ptr<DebugManager> makeDebugManager() {
    auto kvs = makeManager();
    kvs->activate();
    auto manager = DebugManager::create(kvs);
    manager->activate();
    platform.cutSubscriptions.push_back([manager] { letGo(*manager); });
    return manager;
  }
  static void letGo(DebugManager& manager) {
    dropSubscriptions(*SystemNotificationManager::shared());
    manager.kvsSubscription.reset();
    manager.systemNotificationSubscription.reset();
  }

  Calls calls;
  fakes::FakePlatform platform;
  const platform::PlatformScope scope{platform};
};

}  // namespace pairwell
