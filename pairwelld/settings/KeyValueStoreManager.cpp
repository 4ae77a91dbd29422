#include "pairwelld/settings/KeyValueStoreManager.hpp"

#include <string_view>
#include <utility>

#include "pairwelld/Log.hpp"
#include "pairwelld/Names.hpp"
#include "pairwelld/settings/CloudStoreHandle.hpp"
#include "platform/Platform.hpp"

namespace pairwell {

std::shared_ptr<KeyValueStoreManager> KeyValueStoreManager::create() {
  return std::shared_ptr<KeyValueStoreManager>(new KeyValueStoreManager);
}

KeyValueStoreManager::KeyValueStoreManager()
    : serialQueue(platform::current().queues().serial("com.kestrel.pairwell.kvs.serial",
                                                      platform::QueueRank::delivery)),
      subscriptionQueue(platform::current().queues().serial("com.kestrel.pairwell.kvs.subscription",
                                                            platform::QueueRank::list)) {}

// Nobody can reach the manager any more: the observer's closure, if it is made only now, finds it gone.
KeyValueStoreManager::~KeyValueStoreManager() { KeyValueStoreManager::keyValueStoreObserver()->stop(); }

std::shared_ptr<KeyValueStoreCustomObserver> KeyValueStoreManager::keyValueStoreObserver() {
  if (!keyValueStoreObserver_) {
    std::vector<std::string> keys;
    for (Defaults key : platform::allCases<Defaults>()) keys.emplace_back(platform::rawValue(key));
    keyValueStoreObserver_ = KeyValueStoreCustomObserver::create(
        std::move(keys),
        [weak = weak_from_this()](KeyValueSource source, const std::vector<std::string>& changed) {
          if (auto self = weak.lock()) self->handleStoreChange(source, changed);
        });
  }
  return keyValueStoreObserver_;
}

void KeyValueStoreManager::setKeyValueStoreObserver(std::shared_ptr<KeyValueStoreCustomObserver> observer) {
  keyValueStoreObserver_ = std::move(observer);
}

void KeyValueStoreManager::activate() {
  Log::daemon().default_("Activate KeyValueStoreManager");
  keyValueStoreObserver()->start();
}

bool KeyValueStoreManager::getBool(KeyValueSource source, Defaults key) {
  const std::string_view name = platform::rawValue(key);
  if (source == KeyValueSource::cloud) return cloudStoreHandle()->boolForKey(name);
  if (source == KeyValueSource::user) return platform::current().userPreferences()->boolForKey(name);
  const auto value = readRoot("Unable to get bool for key: %s due to: %s", key);
  return value && platform::toBool(*value).value_or(false);
}

double KeyValueStoreManager::getDouble(KeyValueSource source, Defaults key) {
  const std::string_view name = platform::rawValue(key);
  if (source == KeyValueSource::cloud) return cloudStoreHandle()->doubleForKey(name);
  if (source == KeyValueSource::user) return platform::current().userPreferences()->doubleForKey(name);
  const auto value = readRoot("Unable to get double for key: %s due to: %s", key);
  return value ? platform::toDouble(*value).value_or(0.0) : 0.0;
}

std::optional<platform::Value> KeyValueStoreManager::readRoot(std::string_view format, Defaults key) {
  const std::string name(platform::rawValue(key));
  const auto values = platform::current().radixController().readPrefKeys({name});
  if (!values) {
    Log::kvs().error(format, name, [&] { return values.error().message(); });
    return std::nullopt;
  }
  return platform::valueOf(*values, name);
}

void KeyValueStoreManager::setValue(KeyValueSource source, const std::optional<platform::Value>& value,
                                    Defaults key) {
  const std::string_view name = platform::rawValue(key);
  switch (source) {
    case KeyValueSource::cloud:
      setCloudValue(value, name);
      break;
    case KeyValueSource::user:
      // Reported by the observer's key observation.
      platform::current().userPreferences()->setValue(value, name);
      break;
    case KeyValueSource::root:
      setRootValue(value, name);
      break;
  }
}

void KeyValueStoreManager::setCloudValue(const std::optional<platform::Value>& value, std::string_view key) {
  const auto store = cloudStoreHandle();
  store->setValue(value, key);
  const bool synchronised = store->synchronise();
  Log::kvs().default_(
      "Cloud Update Key Value %s: %s, Synced: %{bool}d", key, [&] { return platform::describe(value); },
      synchronised);
  platform::Dictionary userInfo;
  userInfo.emplace(platform::CloudStore::changedKeysKey, platform::List{platform::Value(key)});
  platform::current().notificationCentre().post(cloudStoreChangedNotification, nullptr, std::move(userInfo));
}

void KeyValueStoreManager::setRootValue(const std::optional<platform::Value>& value, std::string_view key) {
  const auto written =
      platform::current().radixController().writePrefKey(key, value.value_or(platform::Value(nullptr)));
  if (!written) {
    Log::kvs().error("Unable to get value for key: %s due to: %s", key,
                     [&] { return written.error().message(); });
    return;
  }
  platform::current().namedNotifications().post(names::rootPrefsChanged);
}

void KeyValueStoreManager::setValue(const std::vector<KeyValueSource>& sources,
                                    const std::optional<platform::Value>& value, Defaults key) {
  for (KeyValueSource source : sources) setValue(source, value, key);
}

Subscription<KeyValueStoreManagerSubscribing> KeyValueStoreManager::subscribe(
    const std::shared_ptr<Subscriber>& subscriber) {
  return subscribeTo(*this, subscriber, &KeyValueStoreManager::unsubscribe);
}

void KeyValueStoreManager::unsubscribe(const Subscription<Subscriber>& subscription) {
  unsubscribeFrom(*this, subscription);
}

void KeyValueStoreManager::handleStoreChange(KeyValueSource source, const std::vector<std::string>& keys) {
  if (keys.empty()) {
    notifySubscribers(source, std::nullopt);
    return;
  }
  for (const std::string& key : keys) notifySubscribers(source, key);
  platform::current().namedNotifications().post(names::prefsChanged);
}

void KeyValueStoreManager::notifySubscribers(KeyValueSource source, const std::optional<std::string>& key) {
  serialQueue->async([weak = weak_from_this(), source, key] {
    auto self = weak.lock();
    if (!self) return;
    self->serialQueue->assertCurrent();
    self->deliverChange(source, key);
  });
}

void KeyValueStoreManager::deliverChange(KeyValueSource source, const std::optional<std::string>& key) {
  std::vector<Subscription<Subscriber>> current;
  subscriptionQueue->sync([&] {
    subscriptionQueue->assertCurrent();
    current = subscriptions;
  });
  std::vector<std::string> keys;
  if (key) keys.push_back(*key);
  for (const auto& subscription : current) subscription.subscriber()->keyValueChanged(source, keys);
}

}  // namespace pairwell
