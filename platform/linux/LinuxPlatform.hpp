// The platform on Linux: one device, of the root that HEARTH_ROOT names, or the system's.
#pragma once

#include <memory>
#include <string>

#include "platform/Platform.hpp"

namespace platform::linux_ {

// Opens nothing before a service is first asked for: a process that was started wrongly touches nothing.
// Lives as long as the process; finish() ends both.
class LinuxPlatform : public Platform {
 public:
  // Main thread, before any other: blocks the signals that end the process, which the run loop reads.
  LinuxPlatform();
  ~LinuxPlatform() override;

  RunLoop& runLoop() override;
  Queues& queues() override;
  LogSink& logSink() override;
  ProcessEnvironment& environment() override;
  Clock& clock() override;
  SystemControl& systemControl() override;
  DeviceProperties& deviceProperties() override;
  NamedNotifications& namedNotifications() override;
  NamedNotificationCentre* namedNotificationCentre() override;
  NotificationCentre& notificationCentre() override;
  std::shared_ptr<UserPreferences> userPreferences() override;
  std::shared_ptr<CloudStore> makeCloudStore(std::string_view identifier, int typeCode) override;
  RadixController& radixController() override;
  EventStreams& eventStreams() override;
  std::shared_ptr<ServiceListener> makeServiceListener(std::string_view serviceName) override;

  // Main thread, after the run loop has ended: accepting and reading stop, queues drain and answers leave
  // until a deadline of 2 s, then the process ends with `status`. No destructor runs: work may still be under
  // way.
  [[noreturn]] void finish(int status);

 private:
  struct Services;
  const std::unique_ptr<Services> services;
};

}  // namespace platform::linux_
