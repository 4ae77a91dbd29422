// Reads, writes and change notices of the three sources, through manager and observer.
#include "pairwelld/settings/CloudStoreHandle.hpp"
#include "pairwelld/settings/KeyValueStoreCustomObserver.hpp"
#include "tests/pairwelld/World.hpp"

namespace pairwell {
namespace {

using platform::CloudStore;
using platform::Dictionary;
using platform::List;

constexpr auto cloud = KeyValueSource::cloud, root = KeyValueSource::root, user = KeyValueSource::user;
constexpr auto flag = Defaults::velaLogCloudCollectionEnabled;
constexpr auto end = Defaults::velaLogCloudCollectionEnabledExpiration;
constexpr const char* pairwellPost = "post pairwell.prefsChanged";

class KeyValueStoreManagerTest : public World {
 protected:
  std::shared_ptr<KeyValueStoreManager> makeActive() {
    auto kvs = makeManager();
    kvs->activate();
    mark();
    return kvs;
  }
  void store(KeyValueSource source, const std::optional<Value>& value) {
    platform.radix.contents.clear();
    if (source == root && value) platform.radix.contents.emplace(flagKey, *value);
    if (source == cloud) platform.cloud->store(flagKey, value);
    if (source == user) platform.user->store(flagKey, value);
  }
  std::shared_ptr<KeyValueStoreCustomObserver> makeObserver() {
    return KeyValueStoreCustomObserver::create(
        {flagKey, "b"}, [this](KeyValueSource source, const std::vector<std::string>& keys) {
          std::string call(platform::rawValue(source));
          for (const auto& key : keys) call += " " + Effects::shortKey(key);
          calls.push_back(call);
        });
  }
  Calls callsAfterRun() {
    calls.clear();
    run();
    return calls;
  }
};

TEST_F(KeyValueStoreManagerTest, ReadsAnswerWhatConvertsOrNothing) {
  const auto kvs = makeManager();
  const struct {
    const char* name;
    std::optional<Value> stored;
    bool asBool;
    double asDouble;
  } table[] = {{"absent", {}, false, 0},       {"true", true, true, 1}, {"fraction", 1.5, false, 1.5},
               {"whole number", 1, true, 1.0}, {"text", "1", false, 0}, {"list", List{1}, false, 0}};
  for (const auto& row : table) {
    for (KeyValueSource source : {cloud, root, user}) {
      SCOPED_TRACE(std::string(row.name) + " in " + std::string(platform::rawValue(source)));
      store(source, row.stored);
      EXPECT_EQ(kvs->getBool(source, flag), row.asBool);
      EXPECT_EQ(kvs->getDouble(source, flag), row.asDouble);
    }
  }
  EXPECT_THAT(log(), IsEmpty());
  platform.radix.failure = std::make_error_code(std::errc::io_error);
  EXPECT_FALSE(kvs->getBool(root, flag));
  EXPECT_EQ(kvs->getDouble(root, end), 0);
  EXPECT_THAT(
      log(),
      ElementsAre(
          "kvs error: Unable to get bool for key: VelaLogCloudCollectionEnabled due to: Input/output error",
          "kvs error: Unable to get double for key: VelaLogCloudCollectionEnabledExpiration due to: "
          "Input/output error"));
}

TEST_F(KeyValueStoreManagerTest, WritesHaveTheirEffectsInOrder) {
  const auto kvs = makeActive();
  const auto updated = [](std::string rest) {
    return "kvs default: Cloud Update Key Value VelaLogCloudCollectionEnabled: " + rest;
  };
  const auto effectsOf = [&](const std::vector<KeyValueSource>& sources, const std::optional<Value>& value) {
    mark();
    kvs->setValue(sources, value, flag);
    return effects(~0u);
  };
  EXPECT_THAT(effectsOf({root, cloud}, true),
              ElementsAre("root flag=true", "post bluetooth.prefsChanged", "cloud flag=true",
                          updated("true, Synced: true"), "post cloud.storeChanged", pairwellPost));
  EXPECT_THAT(
      effectsOf({cloud, user, root}, std::nullopt),
      ElementsAre("cloud flag=nil", updated("nil, Synced: true"), "post cloud.storeChanged", pairwellPost,
                  "user flag=nil", pairwellPost, "root flag=null", "post bluetooth.prefsChanged"));
  EXPECT_TRUE(platform.cloud->contents.empty() && platform.radix.contents.empty());
  platform.radix.failure = std::make_error_code(std::errc::no_space_on_device);
  platform.cloud->failing = true;
  EXPECT_THAT(effectsOf({root, cloud}, false),
              ElementsAre("root flag=false failed",
                          "kvs error: Unable to get value for key: VelaLogCloudCollectionEnabled due to: No "
                          "space left on device",
                          "cloud flag=false failed", updated("false, Synced: false"),
                          "post cloud.storeChanged", pairwellPost));
}

TEST_F(KeyValueStoreManagerTest, EachChangedKeyReachesEverySubscriberInTurn) {
  const auto kvs = makeManager();
  const auto first = makeSubscriber("1"), second = makeSubscriber("2"), late = makeSubscriber("3");
  const auto handle = kvs->subscribe(first), other = kvs->subscribe(second);
  first->onCall = [&] { EXPECT_TRUE(kvs->serialQueue->isCurrent()); };
  kvs->handleStoreChange(user, {flagKey, "b"});
  EXPECT_THAT(calls, IsEmpty());
  EXPECT_THAT(callsAfterRun(), ElementsAre("1 user flag", "2 user flag", "1 user b", "2 user b"));
  EXPECT_THAT(effects(Effects::post), ElementsAre(pairwellPost));
  mark();
  // Who joins or leaves during a delivery does so for the next one.
  first->onCall = [&] {
    first->onCall = nullptr;
    kvs->subscribe(late);
    kvs->unsubscribe(other);
    on(kvs->subscriptionQueue, [] {});
  };
  kvs->handleStoreChange(root, {});
  EXPECT_THAT(callsAfterRun(), ElementsAre("1 root -", "2 root -"));
  kvs->handleStoreChange(root, {});
  EXPECT_THAT(callsAfterRun(), ElementsAre("1 root -", "3 root -"));
  EXPECT_THAT(effects(Effects::post), IsEmpty());
}

TEST_F(KeyValueStoreManagerTest, ChangesMadeElsewhereArrive) {
  const auto kvs = makeActive();
  kvs->subscribe(makeSubscriber("1"));
  platform.user->changeFromElsewhere(flagKey, true);
  platform.user->changeFromElsewhere("unknown", true);
  EXPECT_THAT(callsAfterRun(), ElementsAre("1 user flag"));
  platform.cloud->changeFromElsewhere({{flagKey, true}, {"unknown", 1}});
  EXPECT_THAT(callsAfterRun(), ElementsAre("1 cloud flag", "1 cloud unknown"));
  platform.named.postFromElsewhere("com.kestrel.bluetooth.prefsChanged");
  EXPECT_THAT(callsAfterRun(), ElementsAre("1 root -"));
  EXPECT_EQ(log().back(), "kvs default: Root KVS Notification");
}

TEST_F(KeyValueStoreManagerTest, OutsideCloudChangesCountByReasonAndKeys) {
  const auto observer = makeObserver();
  observer->start();
  const auto change = [](Value reason, Value keys) {
    return Dictionary{{std::string(CloudStore::changeReasonKey), std::move(reason)},
                      {std::string(CloudStore::changedKeysKey), std::move(keys)}};
  };
  const struct {
    const char* name;
    std::optional<Dictionary> userInfo;
    Calls calls;
  } table[] = {
      {"server", change(0, List{flagKey, "c"}), {"cloud flag c"}},
      {"first download", change(1, List{"c"}), {"cloud c"}},
      {"quota", change(2, List{"c"}), {}},
      {"account", change(3, List{}), {"cloud"}},
      {"unknown", change(4, List{"c"}), {}},
      {"negative", change(-1, List{"c"}), {}},
      {"reason that is no number", change("0", List{"c"}), {}},
      {"keys that are no list", change(0, "c"), {}},
      {"keys that are no texts", change(0, List{"c", 1}), {}},
      {"empty", Dictionary{}, {}},
      {"no user information", {}, {}},
  };
  for (const auto& row : table) {
    SCOPED_TRACE(row.name);
    mark();
    platform.cloud->announce(row.userInfo);
    EXPECT_EQ(callsAfterRun(), row.calls);
    const std::string prefix = "kvs default: Cloud KVS Notification: ";
    EXPECT_EQ(log(), row.userInfo ? Calls{prefix + platform::describe(*row.userInfo)} : Calls{});
  }
  calls.clear();
  platform.centre.post(CloudStore::externalChangeNotification, &platform, change(0, List{"c"}));
  EXPECT_THAT(calls, IsEmpty());
  for (const auto& userInfo : {std::optional<Dictionary>(), std::optional(Dictionary{{"ChangedKeys", 1}})}) {
    platform.centre.post(cloudStoreChangedNotification, &platform, userInfo);
  }
  observer->observeValue(std::nullopt, platform.user.get());
  observer->observeValue("b", platform.cloud.get());
  EXPECT_THAT(calls, ElementsAre("cloud", "cloud", "user b"));
}

TEST_F(KeyValueStoreManagerTest, TheObserverStopsWheneverItIsTold) {
  auto observer = makeObserver();
  observer->stop();
  EXPECT_THAT(platform.named.cancelled, ElementsAre(-1));
  observer->start();
  EXPECT_EQ(observer->rootPrefsChangeToken, 1);
  EXPECT_EQ(platform.user->observers.size() + platform.cloud->observers.size(), 4u);
  platform.named.postFromElsewhere(
      "com.kestrel.bluetooth.prefsChanged");  // on its way when the observer goes
  platform.user->changeFromElsewhere(flagKey, true);
  platform.cloud->changeFromElsewhere({{flagKey, true}});
  observer->stop();
  EXPECT_EQ(platform.user->observers.size() + platform.cloud->observers.size(), 0u);
  observer.reset();
  EXPECT_THAT(platform.named.cancelled, ElementsAre(-1, 1, 1));
  mark();
  EXPECT_THAT(callsAfterRun(), IsEmpty());
  EXPECT_THAT(log(), ElementsAre("kvs default: Root KVS Notification"));
}

TEST_F(KeyValueStoreManagerTest, AManagerEndsAnObserverThatItNeverNeeded) {
  KeyValueStoreManager::create().reset();
  EXPECT_THAT(platform.named.cancelled, ElementsAre(-1, -1));
  auto kvs = KeyValueStoreManager::create();
  kvs->activate();
  const auto subscriber = makeSubscriber("1");
  const auto handle = kvs->subscribe(subscriber);
  kvs->setValue({root, cloud, user}, true, flag);
  kvs.reset();
  handle.unsubscribe([&](const auto& error) { calls.push_back(error ? "error" : "done"); });
  run();
  EXPECT_THAT(calls, ElementsAre("done"));
}

}  // namespace
}  // namespace pairwell
