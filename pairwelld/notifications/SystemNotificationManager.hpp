// Named wall-clock alarms, kept and delivered by the service manager.
#pragma once

#include <memory>
#include <optional>
#include <string_view>
#include <vector>

#include "pairwelld/notifications/Subscribable.hpp"
#include "pairwelld/notifications/Subscription.hpp"
#include "platform/EventStreams.hpp"
#include "platform/RawValue.hpp"
#include "platform/ThreadAnnotations.hpp"
#include "platform/Value.hpp"
#include "platform/WorkQueue.hpp"

namespace pairwell {

enum class SystemNotificationSource { alarm };

class SystemNotificationManagerSubscribing {
 public:
  virtual ~SystemNotificationManagerSubscribing() = default;
  // Main queue; must not block it.
  virtual void didReceiveNotification(SystemNotificationSource source, std::string_view name) = 0;
};

// One per process. Alarms outlive the process; subscriptions do not.
class SystemNotificationManager : public std::enable_shared_from_this<SystemNotificationManager> {
 public:
  using Subscriber = SystemNotificationManagerSubscribing;
  enum class Constants { systemAlarm };

  const std::shared_ptr<platform::SerialQueue> subscriptionQueue;
  std::vector<Subscription<Subscriber>> subscriptions PW_GUARDED_BY(*subscriptionQueue);

  static std::shared_ptr<SystemNotificationManager> shared();
  // Installs the stream's handler, which keeps the manager alive.
  static std::shared_ptr<SystemNotificationManager> create();
  virtual ~SystemNotificationManager() = default;

  // Any thread. The fraction of a second is dropped, so an alarm may fire up to a second early. A time
  // without a date is rejected with a logged error, and an earlier alarm of the name stays as it was.
  virtual void scheduleAlarm(std::string_view name, platform::Time date);
  virtual void scheduleAlarm(std::string_view name, double secondsSince1970);
  virtual void cancelAlarm(std::string_view name);

  // Any thread; waits for subscriptionQueue.
  Subscription<Subscriber> subscribe(const std::shared_ptr<Subscriber>& subscriber);

 protected:
  SystemNotificationManager();

 private:
  void handle(const platform::Dictionary& event);
};

}  // namespace pairwell

template <>
inline constexpr platform::RawValues<pairwell::SystemNotificationSource, 1>
    platform::rawValues<pairwell::SystemNotificationSource> = {
        {{pairwell::SystemNotificationSource::alarm, "alarm"}}};

template <>
inline constexpr platform::RawValues<pairwell::SystemNotificationManager::Constants, 1>
    platform::rawValues<pairwell::SystemNotificationManager::Constants> = {
        {{pairwell::SystemNotificationManager::Constants::systemAlarm, platform::EventStreams::alarms}}};

static_assert(pairwell::Subscribable<pairwell::SystemNotificationManager>);
