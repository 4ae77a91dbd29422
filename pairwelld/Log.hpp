// The daemon's five log channels.
#pragma once

#include <string_view>

#include "platform/LogSink.hpp"

namespace pairwell {

struct LogConstants {
  LogConstants() = delete;
  static constexpr std::string_view subsystem = "com.kestrel.pairwell";
};

// Each is made on first use and lives as long as the process. Any thread.
struct Log {
  Log() = delete;
  static const platform::Logger& daemon();
  static const platform::Logger& debugManager();
  static const platform::Logger& kvs();
  static const platform::Logger& notification();
  static const platform::Logger& conduit();
};

}  // namespace pairwell
