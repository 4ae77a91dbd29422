#include "pairwelld/service/ConduitConnection.hpp"

#include <utility>

#include "pairwelld/Log.hpp"
#include "pairwelld/debug/DebugManager.hpp"
#include "pairwelld/service/ConduitListener.hpp"
#include "pairwelld/service/RadixDistributedDebugLogging.hpp"
#include "platform/Platform.hpp"

namespace pairwell {
namespace {

void runOnWorker(platform::Work work) { platform::current().queues().workers()->async(std::move(work)); }

}  // namespace

std::shared_ptr<ConduitConnection> ConduitConnection::create(
    std::shared_ptr<ConduitListener> daemon, std::shared_ptr<platform::SerialQueue> dispatchQueue,
    std::shared_ptr<platform::ClientConnection> conduitConnection) {
  return std::shared_ptr<ConduitConnection>(
      new ConduitConnection(std::move(daemon), std::move(dispatchQueue), std::move(conduitConnection)));
}

ConduitConnection::ConduitConnection(std::shared_ptr<ConduitListener> daemon_,
                                     std::shared_ptr<platform::SerialQueue> dispatchQueue_,
                                     std::shared_ptr<platform::ClientConnection> conduitConnection_)
    : daemon(std::move(daemon_)),
      dispatchQueue(std::move(dispatchQueue_)),
      conduitConnection(std::move(conduitConnection_)) {}

void ConduitConnection::getDistributedLoggingStatus(
    std::function<void(std::uint32_t, platform::OptionalError)> completion) {
  runOnWorker([self = shared_from_this(), completion = std::move(completion)] {
    completion(self->readStatus(), std::nullopt);
  });
}

void ConduitConnection::setDistributedLoggingStatus(std::uint32_t status,
                                                    std::function<void(platform::OptionalError)> completion) {
  runOnWorker([self = shared_from_this(), status, completion = std::move(completion)] {
    self->writeStatus(status);
    completion(std::nullopt);
  });
}

void ConduitConnection::kestrelAudioAccessoryLimitedLogging(
    std::function<void(bool, platform::OptionalError)> completion) {
  runOnWorker([self = shared_from_this(), completion = std::move(completion)] {
    completion(self->readSwitch(), std::nullopt);
  });
}

void ConduitConnection::setKestrelAudioAccessoryLimitedLogging(
    bool enabled, std::function<void(platform::OptionalError)> completion) {
  runOnWorker([self = shared_from_this(), enabled, completion = std::move(completion)] {
    self->writeSwitch(enabled);
    completion(std::nullopt);
  });
}

void ConduitConnection::getCurrentUserGivenName(
    std::function<void(std::optional<std::string>, platform::OptionalError)> completion) {
  completion(std::string(), std::nullopt);
}

std::uint32_t ConduitConnection::readStatus() {
  RadixDistributedDebugLogging status;
  const auto manager = daemon->debugManager;
  if (manager && manager->audioAccessoryLimitedLoggingEnabled()) {
    status.insert(RadixDistributedDebugLogging::audioAccessory);
  }
  Log::conduit().default_("Distributed logging status: %u", status.rawValue);
  return status.rawValue;
}

void ConduitConnection::writeStatus(std::uint32_t status) {
  const RadixDistributedDebugLogging received(status);
  if (const auto manager = daemon->debugManager) {
    manager->setAudioAccessoryLimitedLoggingEnabled(
        received.contains(RadixDistributedDebugLogging::audioAccessory));
  }
  Log::conduit().default_("Distributed logging status changed: %u", received.rawValue);
}

bool ConduitConnection::readSwitch() {
  const auto manager = daemon->debugManager;
  if (!manager) return false;
  const bool enabled = manager->audioAccessoryLimitedLoggingEnabled();
  Log::conduit().default_("Kestrel audio accessory limited logging enabled: %{bool}d", enabled);
  return enabled;
}

void ConduitConnection::writeSwitch(bool enabled) {
  Log::conduit().default_("Enable Kestrel audio accessory limited logging: %s", enabled ? "Yes" : "No");
  if (const auto manager = daemon->debugManager) manager->setAudioAccessoryLimitedLoggingEnabled(enabled);
}

}  // namespace pairwell
