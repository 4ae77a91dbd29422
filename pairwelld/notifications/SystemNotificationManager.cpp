#include "pairwelld/notifications/SystemNotificationManager.hpp"

#include <cmath>
#include <cstdint>
#include <utility>

#include "pairwelld/Log.hpp"
#include "platform/Platform.hpp"

namespace pairwell {
namespace {

const platform::SlotKey sharedKey;

constexpr std::string_view alarmStream =
    platform::rawValue(SystemNotificationManager::Constants::systemAlarm);
constexpr std::string_view dateKey = "Date";
constexpr std::int64_t nanosecondsPerSecond = 1'000'000'000;
constexpr double lastAlarmSecond = 9223372036;

}  // namespace

std::shared_ptr<SystemNotificationManager> SystemNotificationManager::shared() {
  return platform::current().slot<std::shared_ptr<SystemNotificationManager>>(sharedKey,
                                                                              [] { return create(); });
}

std::shared_ptr<SystemNotificationManager> SystemNotificationManager::create() {
  std::shared_ptr<SystemNotificationManager> manager(new SystemNotificationManager);
  platform::current().eventStreams().setHandler(
      alarmStream, platform::current().runLoop().mainQueue(),
      // Strong: the stream is handled for as long as the process lives.
      [manager](const platform::Dictionary& event) { manager->handle(event); });
  return manager;
}

SystemNotificationManager::SystemNotificationManager()
    : subscriptionQueue(platform::current().queues().serial(
          "com.kestrel.pairwell.systemNotification.subscription", platform::QueueRank::list)) {}

void SystemNotificationManager::scheduleAlarm(std::string_view name, platform::Time date) {
  scheduleAlarm(name, date.count());
}

void SystemNotificationManager::scheduleAlarm(std::string_view name, double secondsSince1970) {
  Log::notification().default_("Scheduling alarm: %s for %f", name, secondsSince1970);
  const auto date = alarmDate(secondsSince1970);
  if (!date) {
    Log::notification().error("Alarm rejected, its time is out of range: %s for %f", name, secondsSince1970);
    return;
  }
  platform::Dictionary descriptor;
  descriptor.emplace(dateKey, *date);
  platform::current().eventStreams().setEvent(alarmStream, name, descriptor);
}

void SystemNotificationManager::cancelAlarm(std::string_view name) {
  Log::notification().default_("Canceling alarm: %s", name);
  platform::current().eventStreams().setEvent(alarmStream, name, std::nullopt);
}

Subscription<SystemNotificationManagerSubscribing> SystemNotificationManager::subscribe(
    const std::shared_ptr<Subscriber>& subscriber) {
  std::optional<Subscription<Subscriber>> subscription;
  subscriptionQueue->sync([&] {
    subscriptionQueue->assertCurrent();
    subscription.emplace(
        subscriber,
        [weak = weak_from_this()](const Subscription<Subscriber>& handle) -> platform::Result<void> {
          if (auto self = weak.lock()) self->unsubscribe(handle);
          return {};
        });
    subscriptions.push_back(*subscription);
  });
  return *subscription;
}

void SystemNotificationManager::unsubscribe(const Subscription<Subscriber>& subscription) {
  subscriptionQueue->async([weak = weak_from_this(), subscription] {
    auto self = weak.lock();
    if (!self) return;
    self->subscriptionQueue->assertCurrent();
    std::erase(self->subscriptions, subscription);
  });
}

void SystemNotificationManager::handle(const platform::Dictionary& event) {
  const auto entry = event.find(platform::EventStreams::nameKey);
  const auto name = entry == event.end() ? std::nullopt : platform::toText(entry->second);
  if (!name) return;
  Log::notification().default_("On conduit event stream, com.kestrel.alarm, notification %s", *name);
  std::vector<Subscription<Subscriber>> current;
  subscriptionQueue->sync([&] {
    subscriptionQueue->assertCurrent();
    current = subscriptions;
  });
  for (const auto& subscription : current) {
    subscription.subscriber()->didReceiveNotification(SystemNotificationSource::alarm, *name);
  }
}

std::optional<platform::Date> SystemNotificationManager::alarmDate(double secondsSince1970) {
  const double seconds = std::trunc(secondsSince1970);
  if (!(std::abs(seconds) <= lastAlarmSecond)) return std::nullopt;  // so that NaN is refused, too
  return platform::Date{static_cast<std::int64_t>(seconds) * nanosecondsPerSecond};
}

}  // namespace pairwell
