// The log of the programs: the system's journal, or lines on standard error. It never blocks.
#pragma once

#include <cstdint>
#include <mutex>
#include <string>
#include <string_view>

#include "platform/LogSink.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

namespace platform::linux_ {

// To the journal (fields SUBSYSTEM, CATEGORY, PRIORITY) where one is running and no root is set; else one
// line an event: time, level, subsystem:category, message, with control characters escaped. A reader that
// does not read loses lines, is told how many once it reads again, and holds up nobody. Any thread.
//
// HEARTH_LOG_LEVEL=info|default|error is the least level written, by default info. HEARTH_LOG_PRIVATE=show
// prints private texts.
class UnifiedLog : public LogSink {
 public:
  // Opens nothing before the first line.
  explicit UnifiedLog(bool rootIsSet);

  bool enabled(const LogChannel&, LogLevel level) override { return level >= leastLevel; }
  void write(const LogChannel& channel, LogLevel level, std::string_view format,
             std::span<const LogArgument> arguments) override;

 private:
  enum class Kind { unopened, journal, pipe, file, socket, other };
  void open();
  bool send(const LogChannel& channel, LogLevel level, const std::string& message);
  bool sendBytes(std::string_view bytes);

  const bool rootIsSet;
  LogLevel leastLevel = LogLevel::info;
  bool showPrivate = false;

  std::mutex mutex;  // guards everything below
  Kind kind = Kind::unopened;
  UniqueDescriptor own;  // the journal's socket, or the pipe opened anew
  std::uint64_t dropped = 0;
};

}  // namespace platform::linux_
