// The registry of platform services, and the process-wide objects that belong to one device.
#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <functional>
#include <memory>
#include <mutex>
#include <string_view>
#include <vector>

#include "platform/Environment.hpp"
#include "platform/EventStreams.hpp"
#include "platform/LogSink.hpp"
#include "platform/NamedNotifications.hpp"
#include "platform/NotificationCentre.hpp"
#include "platform/RunLoop.hpp"
#include "platform/ServiceListener.hpp"
#include "platform/Stores.hpp"
#include "platform/WorkQueue.hpp"

namespace platform {

// Stops the process for a broken invariant or launch precondition: `text` on standard error, then abort().
[[noreturn]] void stop(std::string_view text);

// The place of one process-wide object, a constant with static lifetime.
class SlotKey {
 public:
  SlotKey() : index(count++) {}
  const std::size_t index;

 private:
  static inline std::size_t count = 0;
};

// One device's services. The programs install one for the process; simulations make one a device and run each
// device's work with its own current. Services are looked up at the moment of use, from any thread.
class Platform {
 public:
  virtual ~Platform() = default;

  virtual RunLoop& runLoop() = 0;
  virtual Queues& queues() = 0;
  virtual LogSink& logSink() = 0;
  virtual ProcessEnvironment& environment() = 0;
  virtual Clock& clock() = 0;
  virtual SystemControl& systemControl() = 0;
  virtual DeviceProperties& deviceProperties() = 0;
  virtual NamedNotifications& namedNotifications() = 0;
  // Null where the platform has none.
  virtual NamedNotificationCentre* namedNotificationCentre() = 0;
  virtual NotificationCentre& notificationCentre() = 0;
  virtual std::shared_ptr<UserPreferences> userPreferences() = 0;
  virtual std::shared_ptr<CloudStore> makeCloudStore(std::string_view identifier, int typeCode) = 0;
  virtual RadixController& radixController() = 0;
  virtual EventStreams& eventStreams() = 0;
  virtual std::shared_ptr<ServiceListener> makeServiceListener(std::string_view serviceName) = 0;

  // Where a test intercepts stop(), by throwing; returning lets the process stop.
  virtual void willStop(std::string_view) {}

  // The object of `key`, made by `make` on first use, once and thread-safely.
  template <class T, class Make>
  T& slot(const SlotKey& key, Make make) {
    Slot& slot = slots.at(key.index);
    std::call_once(slot.once, [&] {
      auto object = std::make_shared<T>(make());
      slot.object = std::move(object);
    });
    return *static_cast<T*>(slot.object.get());
  }
  // Releases all slots; the platform must be current, and nothing may use them any more.
  void clearSlots();

 private:
  struct Slot {
    std::once_flag once;
    std::shared_ptr<void> object;
  };
  std::array<Slot, 16> slots;
};

// The platform whose work this thread runs: the innermost PlatformScope's, else the installed one; null if
// neither.
Platform* currentOrNull();
// The same, where there must be one.
Platform& current();
// Once, by a program's main. The platform stays for the life of the process.
void install(Platform& platform);

// Makes `platform` current on this thread for as long as it lives.
class PlatformScope {
 public:
  explicit PlatformScope(Platform& platform);
  ~PlatformScope();
  PlatformScope(const PlatformScope&) = delete;
  PlatformScope& operator=(const PlatformScope&) = delete;

 private:
  Platform* const previous;
};

}  // namespace platform
