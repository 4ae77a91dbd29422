#include "pairwelld/notifications/SystemNotificationManager.hpp"

#include <utility>

#include "pairwelld/Log.hpp"
#include "platform/Platform.hpp"

namespace pairwell {
namespace {

const platform::SlotKey sharedKey;

constexpr std::string_view alarmStream =
    platform::rawValue(SystemNotificationManager::Constants::systemAlarm);
constexpr std::string_view dateKey = "Date";

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
  const auto date = platform::Date::ofSeconds(secondsSince1970);
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
  return subscribeTo(*this, subscriber, unsubscribeFrom<SystemNotificationManager>);
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

}  // namespace pairwell
