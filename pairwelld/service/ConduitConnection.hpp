// Serves one admitted client.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/RadixUserControllerInterface.hpp"
#include "platform/ServiceListener.hpp"
#include "platform/WorkQueue.hpp"

namespace pairwell {

class ConduitListener;

// One a client, from its admission until its connection has ended. No state of its own: each request asks the
// listener's debug manager, on the worker pool; an accepted one completes though its client has gone. A read
// right after a write may still answer the old state.
class ConduitConnection : public platform::RadixUserControllerInterface,
                          public std::enable_shared_from_this<ConduitConnection> {
 public:
  // Strong: a request in flight needs its listener.
  const std::shared_ptr<ConduitListener> daemon;
  // The listener's serialQueue; no operation runs on it.
  const std::shared_ptr<platform::SerialQueue> dispatchQueue;
  const std::shared_ptr<platform::ClientConnection> conduitConnection;

  static std::shared_ptr<ConduitConnection> create(
      std::shared_ptr<ConduitListener> daemon, std::shared_ptr<platform::SerialQueue> dispatchQueue,
      std::shared_ptr<platform::ClientConnection> conduitConnection);

  // The connection has ended.
  virtual void invalidated() {}

  void getDistributedLoggingStatus(
      std::function<void(std::uint32_t, platform::OptionalError)> completion) override;
  void setDistributedLoggingStatus(std::uint32_t status,
                                   std::function<void(platform::OptionalError)> completion) override;
  void kestrelAudioAccessoryLimitedLogging(
      std::function<void(bool, platform::OptionalError)> completion) override;
  void setKestrelAudioAccessoryLimitedLogging(
      bool enabled, std::function<void(platform::OptionalError)> completion) override;
  // Answers an empty name at once, on the delivering thread.
  void getCurrentUserGivenName(
      std::function<void(std::optional<std::string>, platform::OptionalError)> completion) override;

 protected:
  ConduitConnection(std::shared_ptr<ConduitListener> daemon_,
                    std::shared_ptr<platform::SerialQueue> dispatchQueue_,
                    std::shared_ptr<platform::ClientConnection> conduitConnection_);

 private:
  std::uint32_t readStatus();
  void writeStatus(std::uint32_t status);
  bool readSwitch();
  void writeSwitch(bool enabled);
};

}  // namespace pairwell
