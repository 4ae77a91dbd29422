#include "pairwelld/SystemInfo.hpp"

#include "pairwelld/Log.hpp"
#include "platform/Platform.hpp"

namespace pairwell {
namespace {

std::string text(const std::optional<platform::Value>& answer) {
  return answer ? platform::toText(*answer).value_or("") : "";
}

std::optional<std::int64_t> integer(const std::optional<platform::Value>& answer) {
  return answer ? platform::toInteger(*answer) : std::nullopt;
}

}  // namespace

std::string SystemInfo::deviceName() const { return text(deviceAnswer("UserAssignedDeviceName")); }
std::string SystemInfo::regionCode() const { return text(deviceAnswer("h63QSdBCiT/z0WU6rdQv6Q")); }
std::string SystemInfo::productType() const { return text(deviceAnswer("ProductType")); }
std::string SystemInfo::architecture() const { return text(deviceAnswer("k7QIBwZJJOVw+Sej/8h8VA")); }
std::string SystemInfo::buildVersion() const { return text(deviceAnswer("BuildVersion")); }
std::string SystemInfo::hardwareModel() const { return text(deviceAnswer("/YYygAofPDbhrwToVsXdeA")); }
std::string SystemInfo::uniqueDeviceID() const { return text(deviceAnswer("UniqueDeviceID")); }
std::string SystemInfo::osVersion() const { return text(deviceAnswer("ProductVersion")); }
std::optional<std::int64_t> SystemInfo::ecid() const { return integer(deviceAnswer("UniqueChipID")); }
std::optional<std::int64_t> SystemInfo::chipID() const { return integer(deviceAnswer("ChipID")); }

bool SystemInfo::internalBuild() const {
  return platform::current().deviceProperties().isInternalBuild() != 0;
}

bool SystemInfo::underTest() const {
  if (!internalBuild()) return false;
  return platform::current().environment().all().contains("ProbeConfigurationFilePath");
}

std::optional<platform::Value> SystemInfo::deviceAnswer(std::string_view key) const {
  std::int32_t error = 0;
  auto answer = platform::current().deviceProperties().copyAnswerWithError(key, error);
  if (!answer) return std::nullopt;
  if (error != 0) {
    Log::daemon().error("SextantCopyAnswerWithError error for key: %s -> %s", key,
                        [&] { return std::to_string(error); });
  }
  return answer;
}

}  // namespace pairwell
