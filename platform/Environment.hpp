// Small facts that the platform answers: environment, time, kernel values, device properties.
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Value.hpp"

namespace platform {

// Any thread, all of them.
class ProcessEnvironment {
 public:
  virtual ~ProcessEnvironment() = default;
  virtual std::optional<std::string> variable(std::string_view name) = 0;
  virtual std::map<std::string, std::string, std::less<>> all() = 0;
};

class Clock {
 public:
  virtual ~Clock() = default;
  // Wall-clock time.
  virtual Time now() = 0;
};

class SystemControl {
 public:
  virtual ~SystemControl() = default;
  // Fills `buffer` with the value of `name`, its terminating zero byte included, and sets `length` to what
  // was filled. 0, or -1 with errno set.
  virtual int sysctlbyname(const char* name, void* buffer, std::size_t* length) = 0;
};

class DeviceProperties {
 public:
  virtual ~DeviceProperties() = default;
  // The property `key`, and an error code which may be non-zero beside a value. No options exist.
  virtual std::optional<Value> copyAnswerWithError(std::string_view key, std::int32_t& error) = 0;
  // Non-zero on the maker's internal builds of the operating system.
  virtual int isInternalBuild() = 0;
};

}  // namespace platform
