#include "pairwelld/debug/DebugManager.hpp"

#include <system_error>
#include <utility>

#include "pairwelld/Log.hpp"
#include "pairwelld/Names.hpp"
#include "platform/Platform.hpp"

namespace pairwell {
namespace {

using Defaults = KeyValueStoreManager::Defaults;

constexpr platform::Time defaultPeriod{345600};  // 4 days
constexpr std::string_view alarmName = platform::rawValue(Defaults::velaLogCloudCollectionEnabled);

double secondsSince1970() { return platform::current().clock().now().count(); }

}  // namespace

std::shared_ptr<DebugManager> DebugManager::create(std::shared_ptr<KeyValueStoreManager> kvs) {
  return std::shared_ptr<DebugManager>(new DebugManager(std::move(kvs)));
}

DebugManager::DebugManager(std::shared_ptr<KeyValueStoreManager> kvs_)
    : kvs(std::move(kvs_)),
      serialQueue(platform::current().queues().serial("com.kestrel.pairwell.kvs.serialQueue",
                                                      platform::QueueRank::state)) {}

// The subscription to alarms is not given back: its handle, as the other, holds this object, so that the
// destructor runs only where both lists have let go already; and its publisher lives as long as the process.
DebugManager::~DebugManager() {
  if (!kvsSubscription) return;
  kvsSubscription->unsubscribe([](const std::optional<std::error_code>& error) {
    if (!error) return;
    Log::debugManager().error("DebugManager unable to unsubscribe: %s", [&] { return error->message(); });
  });
}

bool DebugManager::audioAccessoryLimitedLoggingEnabled() {
  bool enabled = false;
  serialQueue->sync([&] {
    serialQueue->assertCurrent();
    enabled = _audioAccessoryLimitedLoggingEnabled;
  });
  const double end = endTime();
  if (!enabled) return false;
  if (!(end > 0)) return true;
  if (end >= secondsSince1970()) return true;
  Log::debugManager().default_("Audio accessory limited logging expired");
  setAudioAccessoryLimitedLoggingEnabled(false);
  return false;
}

void DebugManager::setAudioAccessoryLimitedLoggingEnabled(bool enabled) {
  serialQueue->async([weak = weak_from_this(), enabled] {
    auto self = weak.lock();
    if (!self) return;
    self->serialQueue->assertCurrent();
    self->applyLimitedLogging(enabled);
  });
}

void DebugManager::applyLimitedLogging(bool enabled) {
  if (_audioAccessoryLimitedLoggingEnabled == enabled) return;
  const double end = endTime();
  if (enabled && (!(end > 0) || end >= secondsSince1970())) {
    startLimitedLogging(end);
  } else {
    stopLimitedLogging();
  }
}

void DebugManager::startLimitedLogging(double storedEndTime) {
  Log::debugManager().default_("Start audio accessory limited logging");
  kvs->setValue({KeyValueSource::root, KeyValueSource::cloud}, true, Defaults::velaLogCloudCollectionEnabled);
  const double end = storedEndTime > 0 ? storedEndTime : expirationDate().count();
  kvs->setValue(KeyValueSource::cloud, end, Defaults::velaLogCloudCollectionEnabledExpiration);
  SystemNotificationManager::shared()->scheduleAlarm(alarmName, end);
  _audioAccessoryLimitedLoggingEnabled = true;
  platform::current().namedNotifications().post(names::settingsChanged);
}

void DebugManager::stopLimitedLogging() {
  Log::debugManager().default_("Stop Audio Accessory Limited Logging");
  kvs->setValue({KeyValueSource::root, KeyValueSource::cloud}, false,
                Defaults::velaLogCloudCollectionEnabled);
  kvs->setValue(KeyValueSource::cloud, std::nullopt, Defaults::velaLogCloudCollectionEnabledExpiration);
  SystemNotificationManager::shared()->cancelAlarm(alarmName);
  _audioAccessoryLimitedLoggingEnabled = false;
  platform::current().namedNotifications().post(names::settingsChanged);
}

double DebugManager::endTime() {
  const double end = kvs->getDouble(KeyValueSource::cloud, Defaults::velaLogCloudCollectionEnabledExpiration);
  return platform::Date::ofSeconds(end) ? end : 0.0;
}

platform::Time DebugManager::expirationDate() {
  const double interval =
      kvs->getDouble(KeyValueSource::user, Defaults::velaLogCloudCollectionExpirationIntervalOverride);
  const bool overridden = interval > 0;
  Log::debugManager().info("Requesting %s expiration interval", [&] {
    return overridden ? "override " + platform::describe(interval) : std::string("default");
  });
  return platform::current().clock().now() + (overridden ? platform::Time(interval) : defaultPeriod);
}

void DebugManager::activate() {
  Log::debugManager().default_("Activate Debug Manager");
  kvsSubscription = kvs->subscribe(shared_from_this());
  enqueueRefresh();
  systemNotificationSubscription = SystemNotificationManager::shared()->subscribe(shared_from_this());
}

void DebugManager::enqueueRefresh() {
  serialQueue->async([weak = weak_from_this()] {
    auto self = weak.lock();
    if (!self) return;
    self->serialQueue->assertCurrent();
    self->refreshFromCloud();
  });
}

void DebugManager::refreshFromCloud() {
  const bool enabled = kvs->getBool(KeyValueSource::cloud, Defaults::velaLogCloudCollectionEnabled);
  serialQueue->async([weak = weak_from_this(), enabled] {
    auto self = weak.lock();
    if (!self) return;
    self->serialQueue->assertCurrent();
    self->applyRefresh(enabled);
  });
}

// A write of what was read may come behind a client's:
// 1. a refresh reads "on";
// 2. a client's "off", queued before the refresh's write, clears the flag;
// 3. the write, taken as it is, would set it again: the client's word is lost, and the two go on undoing each
//    other through the changes that they report.
// So the flag is read again when the write has its turn. A look before the write is queued leaves step 2
// open.
void DebugManager::applyRefresh(bool enabled) {
  if (kvs->getBool(KeyValueSource::cloud, Defaults::velaLogCloudCollectionEnabled) != enabled) {
    enqueueRefresh();
    return;
  }
  applyLimitedLogging(enabled);
}

void DebugManager::keyValueChanged(KeyValueSource source, const std::vector<std::string>&) {
  Log::debugManager().default_("keyValueChanged source: %s", platform::rawValue(source));
  enqueueRefresh();
}

void DebugManager::didReceiveNotification(SystemNotificationSource source, std::string_view name) {
  if (name != alarmName) return;
  Log::debugManager().default_("didReceieve notification from source: %s, name: %s",
                               platform::rawValue(source), name);
  setAudioAccessoryLimitedLoggingEnabled(false);
}

}  // namespace pairwell
