// The process's environment, and the machine's clock.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Environment.hpp"

namespace platform::linux_ {

class LinuxEnvironment : public ProcessEnvironment {
 public:
  std::optional<std::string> variable(std::string_view name) override;
  std::map<std::string, std::string, std::less<>> all() override;
};

class LinuxClock : public Clock {
 public:
  Time now() override;
};

}  // namespace platform::linux_
