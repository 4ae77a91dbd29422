#include "pairwelld/settings/KeyValueStoreCustomObserver.hpp"

#include <string_view>
#include <utility>

#include "pairwelld/Log.hpp"
#include "pairwelld/Names.hpp"
#include "pairwelld/settings/CloudStoreHandle.hpp"
#include "platform/Platform.hpp"

namespace pairwell {
namespace {

using platform::CloudStore;
using ChangeReason = CloudStore::ChangeReason;

std::optional<std::vector<std::string>> changedKeys(const platform::Dictionary& userInfo) {
  const auto value = platform::valueOf(userInfo, CloudStore::changedKeysKey);
  return value ? platform::toTexts(*value) : std::nullopt;
}

// Missing or no integer, it is one of those that are ignored: whoever posted it has not said that values
// changed.
bool reportsValues(const platform::Dictionary& userInfo) {
  const auto value = platform::valueOf(userInfo, CloudStore::changeReasonKey);
  const auto reason = value ? platform::toInteger(*value) : std::nullopt;
  return reason && *reason >= static_cast<int>(ChangeReason::serverChange) &&
         *reason <= static_cast<int>(ChangeReason::accountChange) &&
         *reason != static_cast<int>(ChangeReason::quotaViolation);
}

}  // namespace

std::shared_ptr<KeyValueStoreCustomObserver> KeyValueStoreCustomObserver::create(
    std::vector<std::string> monitoredUserDefaultKeys, Notify notify) {
  return std::shared_ptr<KeyValueStoreCustomObserver>(
      new KeyValueStoreCustomObserver(std::move(monitoredUserDefaultKeys), std::move(notify)));
}

KeyValueStoreCustomObserver::KeyValueStoreCustomObserver(std::vector<std::string> monitoredUserDefaultKeys_,
                                                         Notify notify_)
    : defaults(platform::current().userPreferences()),
      monitoredUserDefaultKeys(std::move(monitoredUserDefaultKeys_)),
      notify(std::move(notify_)) {}

KeyValueStoreCustomObserver::~KeyValueStoreCustomObserver() { KeyValueStoreCustomObserver::stop(); }

void KeyValueStoreCustomObserver::start() {
  Log::daemon().default_("Start KeyValueStoreCustomObserver");
  for (const std::string& key : monitoredUserDefaultKeys) {
    defaults->addObserver(weak_from_this(), key);
    cloudStoreHandle()->addObserver(weak_from_this(), key);
  }
  observeCloudStore();
  observeRootPreferences();
}

void KeyValueStoreCustomObserver::stop() {
  for (const std::string& key : monitoredUserDefaultKeys) {
    defaults->removeObserver(this, key);
    cloudStoreHandle()->removeObserver(this, key);
  }
  platform::current().notificationCentre().removeObserver(this);
  platform::current().namedNotifications().cancel(rootPrefsChangeToken);
}

void KeyValueStoreCustomObserver::observeCloudStore() {
  const auto store = cloudStoreHandle();
  const bool synchronised = store->synchronise();
  Log::kvs().default_("Cloud KVS synchronized: %{bool}d", synchronised);
  Log::kvs().default_("Cloud KVS snapshot: %s",
                      [&] { return platform::describe(store->dictionaryRepresentation()); });
  auto& centre = platform::current().notificationCentre();
  centre.addObserver(shared_from_this(), &KeyValueStoreCustomObserver::handleUbiquitousKeyValueStoreChange,
                     CloudStore::externalChangeNotification, store.get());
  centre.addObserver(shared_from_this(),
                     &KeyValueStoreCustomObserver::handleUbiquitousKeyValueStoreChangeLocally,
                     cloudStoreChangedNotification, nullptr);
}

void KeyValueStoreCustomObserver::observeRootPreferences() {
  // A failed registration leaves root changes unnoticed; the status is not looked at.
  platform::current().namedNotifications().registerHandler(
      names::rootPrefsChanged, rootPrefsChangeToken,
      platform::current().queues().global(platform::QualityOfService::utility),
      [weak = weak_from_this()](std::int32_t) {
        Log::kvs().default_("Root KVS Notification");  // due even if the observer has gone
        if (auto self = weak.lock()) self->notify(KeyValueSource::root, {});
      });
}

void KeyValueStoreCustomObserver::observeValue(const std::optional<std::string>& keyPath, const void*) {
  if (keyPath) notify(KeyValueSource::user, {*keyPath});
}

void KeyValueStoreCustomObserver::handleUbiquitousKeyValueStoreChange(
    const platform::Notification& notification) {
  if (!notification.userInfo) return;
  const platform::Dictionary& userInfo = *notification.userInfo;
  Log::kvs().default_("Cloud KVS Notification: %s", [&] { return platform::describe(userInfo); });
  if (!reportsValues(userInfo)) return;
  if (const auto keys = changedKeys(userInfo)) notify(KeyValueSource::cloud, *keys);
}

void KeyValueStoreCustomObserver::handleUbiquitousKeyValueStoreChangeLocally(
    const platform::Notification& notification) {
  const auto keys = notification.userInfo ? changedKeys(*notification.userInfo) : std::nullopt;
  notify(KeyValueSource::cloud, keys.value_or(std::vector<std::string>{}));
}

}  // namespace pairwell
