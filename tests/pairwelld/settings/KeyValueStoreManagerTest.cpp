// Reads, writes and change notices of the three sources, through manager and observer.
#include "pairwelld/settings/CloudStoreHandle.hpp"
#include "tests/pairwelld/World.hpp"

namespace pairwell {
namespace {

using platform::CloudStore;
using platform::Dictionary;
using platform::List;

constexpr auto cloud = KeyValueSource::cloud, root = KeyValueSource::root, user = KeyValueSource::user;
constexpr auto flag = Defaults::velaLogCloudCollectionEnabled;
constexpr const char *rootChanged = "post bluetooth.prefsChanged", *cloudChanged = "post cloud.storeChanged",
                     *changed = "post pairwell.prefsChanged";

struct KeyValueStoreManagerTest : World {
  // With one subscriber, "1".
  std::shared_ptr<KeyValueStoreManager> makeActive() {
    const auto kvs = makeManager();
    kvs->subscribe(makeSubscriber("1"));
    kvs->activate();
    mark();
    return kvs;
  }
  Calls callsAfterRun() {
    calls.clear();
    run();
    return calls;
  }
};

TEST_F(KeyValueStoreManagerTest, RootReadsAnswerWhatConvertsOrNothing) {
  const auto kvs = makeManager();
  for (const Value& value : {Value(), Value("1"), Value(List{1}), Value(2.5), Value(1)}) {
    platform.radix.contents = {{flagKey, value}};
    EXPECT_EQ(kvs->getBool(root, flag), value == Value(1));
    EXPECT_EQ(kvs->getDouble(root, flag), platform::toDouble(value).value_or(0));
  }
  platform.radix.failure = std::make_error_code(std::errc::io_error);
  EXPECT_FALSE(kvs->getBool(root, flag));
  EXPECT_EQ(kvs->getDouble(root, flag), 0);
  const std::string cause = " for key: " + std::string(flagKey) + " due to: Input/output error";
  EXPECT_THAT(
      log(), ElementsAre("kvs error: Unable to get bool" + cause, "kvs error: Unable to get double" + cause));
}

TEST_F(KeyValueStoreManagerTest, WritesHaveTheirEffectsInOrder) {
  const auto kvs = makeActive();
  const std::string updated = "kvs default: Cloud Update Key Value VelaLogCloudCollectionEnabled: ";
  const auto effectsOf = [&](const std::vector<KeyValueSource>& sources, const std::optional<Value>& value) {
    mark();
    kvs->setValue(sources, value, flag);
    return effects(~0u);
  };
  EXPECT_THAT(effectsOf({cloud, user, root}, std::nullopt),
              ElementsAre("cloud flag=nil", updated + "nil, Synced: true", cloudChanged, changed,
                          "user flag=nil", changed, "root flag=null", rootChanged));
  platform.radix.failure = std::make_error_code(std::errc::io_error);
  platform.cloud->failing = true;
  EXPECT_THAT(
      effectsOf({root, cloud}, false),
      ElementsAre(
          "root flag=false failed",
          "kvs error: Unable to get value for key: " + std::string(flagKey) + " due to: Input/output error",
          "cloud flag=false failed", updated + "false, Synced: false", cloudChanged, changed));
}

TEST_F(KeyValueStoreManagerTest, EachChangedKeyReachesEverySubscriberInTurn) {
  const auto kvs = makeManager();
  const auto first = makeSubscriber("1"), late = makeSubscriber("3");
  const auto handle = kvs->subscribe(first), other = kvs->subscribe(makeSubscriber("2"));
  first->onCall = [&] { EXPECT_TRUE(kvs->serialQueue->isCurrent()); };
  kvs->handleStoreChange(user, {flagKey, "b"});
  EXPECT_THAT(calls, IsEmpty());
  EXPECT_THAT(callsAfterRun(), ElementsAre("1 user flag", "2 user flag", "1 user b", "2 user b"));
  EXPECT_THAT(effects(Effects::post), ElementsAre(changed));
  mark();
  // Who joins or leaves during a delivery does so for the next one.
  first->onCall = [&] {
    first->onCall = nullptr;
    kvs->subscribe(late);
    kvs->unsubscribe(other);
    kvs->subscriptionQueue->sync([] {});
  };
  kvs->handleStoreChange(root, {});
  EXPECT_THAT(callsAfterRun(), ElementsAre("1 root -", "2 root -"));
  kvs->handleStoreChange(root, {});
  EXPECT_THAT(callsAfterRun(), ElementsAre("1 root -", "3 root -"));
  EXPECT_THAT(effects(Effects::post), IsEmpty());
}

TEST_F(KeyValueStoreManagerTest, ChangesMadeElsewhereArrive) {
  const auto kvs = makeActive();
  for (const char* key : {flagKey, "unknown", endKey, overrideKey})
    platform.user->changeFromElsewhere(key, true);
  EXPECT_THAT(callsAfterRun(), ElementsAre("1 user flag", "1 user end", "1 user override"));
  changeRoot();
  EXPECT_THAT(callsAfterRun(), ElementsAre("1 root -"));
  EXPECT_THAT(log(), ElementsAre("kvs default: Root KVS Notification"));
  kvs->keyValueStoreObserver()->observeValue(std::nullopt, platform.user.get());
  kvs->keyValueStoreObserver()->observeValue("b", platform.cloud.get());
  EXPECT_THAT(callsAfterRun(), ElementsAre("1 user b"));
}

TEST_F(KeyValueStoreManagerTest, OutsideCloudChangesCountByReasonAndKeys) {
  const auto kvs = makeActive();
  const auto change = [](Value reason, Value keys) {
    return Dictionary{{"ChangeReason", std::move(reason)}, {"ChangedKeys", std::move(keys)}};
  };
  const struct {
    const char* name;
    std::optional<Dictionary> userInfo;
    Calls calls;
  } table[] = {
      {"server", change(0, List{flagKey, "c"}), {"1 cloud flag", "1 cloud c"}},
      {"quota", change(2, List{"c"}), {}},
      {"account", change(3, List{}), {"1 cloud -"}},
      {"unknown", change(4, List{"c"}), {}},
      {"reason that is no number", change("0", List{"c"}), {}},
      {"keys that are no texts", change(0, List{"c", 1}), {}},
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
  platform.centre.post(CloudStore::externalChangeNotification, &platform, table[0].userInfo);
  EXPECT_THAT(callsAfterRun(), IsEmpty()) << "another store's";
  platform.centre.post(cloudStoreChangedNotification, &platform, std::nullopt);
  platform.centre.post(cloudStoreChangedNotification, nullptr, change(0, "c"));
  EXPECT_THAT(callsAfterRun(), ElementsAre("1 cloud -", "1 cloud -"));
}

TEST_F(KeyValueStoreManagerTest, ItsEndStopsTheObserverWhateverIsOnItsWay) {
  auto kvs = KeyValueStoreManager::create();
  kvs->activate();
  EXPECT_EQ(platform.user->observers.size() + platform.cloud->observers.size(), 6u);
  kvs->setValue({root, cloud, user}, true, flag);
  platform.user->changeFromElsewhere(flagKey, true);
  platform.cloud->changeFromElsewhere({{flagKey, true}});
  mark();
  kvs.reset();
  EXPECT_EQ(platform.user->observers.size() + platform.cloud->observers.size(), 0u);
  EXPECT_THAT(platform.named.cancelled, ElementsAre(1, 1)) << "in its end and the observer's";
  run();
  EXPECT_THAT(log(), ElementsAre("kvs default: Root KVS Notification"));
}

}  // namespace
}  // namespace pairwell
