// The daemon object and the process entry.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "pairwelld/Daemon.hpp"
#include "pairwelld/SystemInfo.hpp"
#include "pairwelld/debug/DebugManager.hpp"
#include "pairwelld/service/ConduitListener.hpp"
#include "pairwelld/settings/KeyValueStoreManager.hpp"

namespace pairwell {

// One per process, which holds it to its end. Main thread only.
class PairwellDaemon : public Daemon, public std::enable_shared_from_this<PairwellDaemon> {
 public:
  const std::shared_ptr<KeyValueStoreManager> keyValueStoreManager;

 private:
  std::shared_ptr<DebugManager> debugManager_;

 public:
  // Of the lock-status registration: 0 at first, -1 once it has been cancelled.
  std::int32_t lockVaultToken = 0;

 private:
  std::shared_ptr<SystemInfo> systemInfo_;
  std::shared_ptr<ConduitListener> conduitListener_;

 public:
  // Made on first read, and kept.
  virtual std::shared_ptr<DebugManager> debugManager();
  virtual void setDebugManager(std::shared_ptr<DebugManager> debugManager);
  virtual std::shared_ptr<SystemInfo> systemInfo();
  virtual void setSystemInfo(std::shared_ptr<SystemInfo> systemInfo);
  virtual std::shared_ptr<ConduitListener> conduitListener();
  virtual void setConduitListener(std::shared_ptr<ConduitListener> conduitListener);

  PairwellDaemon();

  // Stops the process unless the service manager started it, before anything is logged or stored.
  void start() override;
  // Waits for the device's first unlock if need be, and is then called again.
  virtual void activate();
  void migrate(const SystemVersionNumber& from, const SystemVersionNumber& to) override;
  void firstLaunchSinceBoot() override;
  virtual void registerForFirstUnlock();

 private:
  void activateServices();
};

// CONDUIT_SERVICE_NAME, read once, on first use. Any thread.
const std::optional<std::string>& serviceName();

// The daemon of this process. Whoever takes a platform down resets it first: its end still uses the cloud
// store handle and the log.
std::shared_ptr<Daemon>& daemon();

// Launches the daemon on the current platform and runs the main thread's loop. The process's exit code.
int runPairwellDaemon();

}  // namespace pairwell
