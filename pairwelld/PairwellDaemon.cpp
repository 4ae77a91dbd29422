#include "pairwelld/PairwellDaemon.hpp"

#include <utility>

#include "pairwelld/Log.hpp"
#include "pairwelld/notifications/TarnNotificationManager.hpp"
#include "platform/Platform.hpp"

namespace pairwell {
namespace {

const platform::SlotKey serviceNameKey;
const platform::SlotKey daemonKey;

}  // namespace

PairwellDaemon::PairwellDaemon() : keyValueStoreManager(KeyValueStoreManager::create()) {}

std::shared_ptr<DebugManager> PairwellDaemon::debugManager() {
  if (!debugManager_) debugManager_ = DebugManager::create(keyValueStoreManager);
  return debugManager_;
}

void PairwellDaemon::setDebugManager(std::shared_ptr<DebugManager> debugManager) {
  debugManager_ = std::move(debugManager);
}

std::shared_ptr<SystemInfo> PairwellDaemon::systemInfo() {
  if (!systemInfo_) systemInfo_ = std::make_shared<SystemInfo>();
  return systemInfo_;
}

void PairwellDaemon::setSystemInfo(std::shared_ptr<SystemInfo> systemInfo) {
  systemInfo_ = std::move(systemInfo);
}

std::shared_ptr<ConduitListener> PairwellDaemon::conduitListener() {
  if (!conduitListener_) conduitListener_ = ConduitListener::create();
  return conduitListener_;
}

void PairwellDaemon::setConduitListener(std::shared_ptr<ConduitListener> conduitListener) {
  conduitListener_ = std::move(conduitListener);
}

void PairwellDaemon::start() {
  const auto& name = serviceName();
  if (!name) platform::stop("pairwelld must be run from hearthd");
  Log::daemon().default_("Launching pairwelld (%s)", *name);
  recordLaunch(std::nullopt, std::nullopt);
  activate();
}

void PairwellDaemon::activate() {
  if (systemInfo()->deviceFirstUnlocked()) {
    Log::daemon().default_("Activate pairwelld services");
    activateServices();
    return;
  }
  Log::daemon().default_("pairwelld is before first unlock");
  registerForFirstUnlock();
}

void PairwellDaemon::migrate(const SystemVersionNumber& from, const SystemVersionNumber& to) {
  if (from < to) {
    Log::daemon().default_("Migrating from %s to %s", from.rawValue, to.rawValue);
  } else {
    Log::daemon().default_("Back-migrating from %s to %s", from.rawValue, to.rawValue);
  }
}

void PairwellDaemon::firstLaunchSinceBoot() { Log::daemon().default_("First launch since boot..."); }

void PairwellDaemon::registerForFirstUnlock() {
  // A failed registration leaves the daemon waiting; the status is not looked at.
  platform::current().namedNotifications().registerHandler(
      "com.kestrel.mobile.lockvaultd.lock_status", lockVaultToken, platform::current().runLoop().mainQueue(),
      [weak = weak_from_this()](std::int32_t) {
        Log::daemon().default_("Device first unlocked notification");
        auto self = weak.lock();
        if (!self) return;
        platform::current().namedNotifications().cancel(self->lockVaultToken);
        self->lockVaultToken = -1;
        self->activate();
      });
}

// The manager is active before the debug manager subscribes to it, and the listener knows the debug manager
// before it admits a client.
void PairwellDaemon::activateServices() {
  keyValueStoreManager->activate();
  debugManager()->activate();
  const auto listener = conduitListener();
  listener->debugManager = debugManager();
  listener->activate();
}

const std::optional<std::string>& serviceName() {
  return platform::current().slot<std::optional<std::string>>(
      serviceNameKey, [] { return platform::current().environment().variable("CONDUIT_SERVICE_NAME"); });
}

std::shared_ptr<Daemon>& daemon() {
  return platform::current().slot<std::shared_ptr<Daemon>>(
      daemonKey, []() -> std::shared_ptr<Daemon> { return std::make_shared<PairwellDaemon>(); });
}

int runPairwellDaemon() {
  daemon()->start();
  // After the launch, a first activation included; before the loop, so that no event is missed.
  TarnNotificationManager::shared()->setUp();
  platform::current().runLoop().run();
  return 0;
}

}  // namespace pairwell
