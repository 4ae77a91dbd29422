// What a daemon is to its process, and the launch history that every one records.
#pragma once

#include <optional>

#include "pairwelld/SystemVersionNumber.hpp"
#include "platform/UUID.hpp"

namespace pairwell {

// Main thread. The history is two entries of the user preferences, "LastOSLaunchVersion" and
// "lastLaunchBootSessionUUID"; neither is ever deleted.
class Daemon {
 public:
  virtual ~Daemon() = default;
  virtual void start() = 0;
  // The build has changed since the last launch.
  virtual void migrate(const SystemVersionNumber& from, const SystemVersionNumber& to) = 0;
  // Comes after migrate() when both are due.
  virtual void firstLaunchSinceBoot() = 0;

  // With versions of a test's, the recorded one is neither read nor written.
  void recordLaunch(const std::optional<SystemVersionNumber>& testLastVersion,
                    const std::optional<SystemVersionNumber>& testCurrentVersion);
  // Stops the process when the kernel gives none.
  platform::UUID bootSessionUUID();
  void recordFirstRunSinceBoot(const platform::UUID& boot);

 private:
  void recordBootSession();
};

}  // namespace pairwell
