#include "platform/linux/LinuxEnvironment.hpp"

#include <unistd.h>

#include <chrono>
#include <cstdlib>

namespace platform::linux_ {

std::optional<std::string> LinuxEnvironment::variable(std::string_view name) {
  const char* value = std::getenv(std::string(name).c_str());
  return value ? std::optional<std::string>(value) : std::nullopt;
}

std::map<std::string, std::string, std::less<>> LinuxEnvironment::all() {
  std::map<std::string, std::string, std::less<>> variables;
  for (char** entry = environ; entry && *entry; ++entry) {
    const std::string_view text(*entry);
    const auto equals = text.find('=');
    if (equals != text.npos) variables.emplace(text.substr(0, equals), text.substr(equals + 1));
  }
  return variables;
}

Time LinuxClock::now() { return std::chrono::system_clock::now().time_since_epoch(); }

}  // namespace platform::linux_
