// Environment, clock, kernel values, device properties and log of a device that a test makes up.
#pragma once

#include <cerrno>
#include <cstring>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/Environment.hpp"
#include "platform/LogSink.hpp"
#include "tests/fakes/Effects.hpp"

namespace fakes {

class FakeEnvironment : public platform::ProcessEnvironment {
 public:
  std::optional<std::string> variable(std::string_view name) override {
    ++reads;
    const auto found = variables.find(name);
    return found == variables.end() ? std::nullopt : std::optional(found->second);
  }
  std::map<std::string, std::string, std::less<>> all() override {
    ++reads;
    return variables;
  }

  std::map<std::string, std::string, std::less<>> variables;
  int reads = 0;
};

// Time passes only in FakePlatform::advance().
class ManualClock : public platform::Clock {
 public:
  platform::Time now() override { return time; }
  platform::Time time{1'000'000};
};

// Knows one name. Fails, with `failure` in errno, when that is not 0.
class FakeSystemControl : public platform::SystemControl {
 public:
  int sysctlbyname(const char* name, void* buffer, std::size_t* length) override {
    const std::size_t needed = bootSession.size() + 1;
    errno = failure                                            ? failure
            : std::string_view(name) != "kern.bootsessionuuid" ? ENOENT
            : *length < needed                                 ? ENOMEM
                                                               : 0;
    if (errno != 0) return -1;
    std::memcpy(buffer, bootSession.c_str(), needed);
    *length = needed;
    return 0;
  }

  std::string bootSession = "01234567-89AB-CDEF-0123-456789ABCDEF";
  int failure = 0;
};

class FakeDeviceProperties : public platform::DeviceProperties {
 public:
  std::optional<platform::Value> copyAnswerWithError(std::string_view key, std::int32_t& error) override {
    if (const auto found = errors.find(key); found != errors.end()) error = found->second;
    const auto found = answers.find(key);
    return found == answers.end() ? std::nullopt : std::optional(found->second);
  }
  int isInternalBuild() override { return internalBuild; }

  platform::Dictionary answers{{"BuildVersion", "21A5248v"}};
  std::map<std::string, std::int32_t, std::less<>> errors;
  int internalBuild = 0;
};

// Keeps what a log would print, private texts shown, as "category level: message"; the error level is marked,
// since that is what an operator filters by.
class FakeLogSink : public platform::LogSink {
 public:
  explicit FakeLogSink(Effects& effects_) : effects(effects_) {}

  bool enabled(const platform::LogChannel&, platform::LogLevel level) override { return level >= minimum; }
  void write(const platform::LogChannel& channel, platform::LogLevel level, std::string_view format,
             std::span<const platform::LogArgument> arguments) override {
    static constexpr const char* names[] = {" info: ", " default: ", " error: "};
    const std::string line = channel.category + names[static_cast<int>(level)] +
                             platform::formatLogMessage(format, arguments, false);
    channels.push_back(channel);
    effects.record(Effects::log, line);
  }

  platform::LogLevel minimum = platform::LogLevel::info;
  std::vector<platform::LogChannel> channels;  // one for each line

 private:
  Effects& effects;
};

}  // namespace fakes
