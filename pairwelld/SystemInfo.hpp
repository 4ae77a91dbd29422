// Facts about the device and its operating system, computed on each read.
#pragma once

#include <concepts>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Value.hpp"

namespace pairwell {

enum class DeviceLockState { unknown, beforeFirstUnlock, locked, unlocked, locking, noPasscode };

template <class Info>
concept SystemInfoProtocol = requires(const Info& info) {
  { info.productType() } -> std::same_as<std::string>;
  { info.buildVersion() } -> std::same_as<std::string>;
  { info.internalBuild() } -> std::same_as<bool>;
};

// Holds nothing and caches nothing. Any thread. A text that the device does not answer is empty, a number
// absent.
class SystemInfo {
 public:
  virtual ~SystemInfo() = default;

  std::string deviceName() const;
  std::string regionCode() const;
  std::string productType() const;
  std::string architecture() const;
  std::string buildVersion() const;
  std::string hardwareModel() const;
  bool internalBuild() const;
  std::string uniqueDeviceID() const;
  // Always true; virtual so that a device can be made to wait for its first unlock.
  virtual bool deviceFirstUnlocked() const { return true; }
  std::optional<std::int64_t> ecid() const;
  std::optional<std::int64_t> chipID() const;
  DeviceLockState lockState() const { return DeviceLockState::unknown; }
  std::string osVersion() const;
  bool underTest() const;

  // A value that comes with an error code is used; the error is logged.
  std::optional<platform::Value> deviceAnswer(std::string_view key) const;
};

static_assert(SystemInfoProtocol<SystemInfo>);

}  // namespace pairwell
