// The unified log, and the channels that write to it.
#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <variant>

namespace platform {

enum class LogLevel { info, default_, error };

struct LogChannel {
  std::string subsystem;
  std::string category;
  // Whether text arguments are printed as <private> unless the operator asks for them.
  bool textIsPrivate;
};

using LogArgument = std::variant<std::string, std::int64_t, std::uint64_t, double, bool>;

// Any thread.
class LogSink {
 public:
  virtual ~LogSink() = default;
  virtual bool enabled(const LogChannel& channel, LogLevel level) = 0;
  // `format` is a constant text with %s, %d, %u, %f and %{bool}d, one for each argument, in order.
  virtual void write(const LogChannel& channel, LogLevel level, std::string_view format,
                     std::span<const LogArgument> arguments) = 0;
};

// Fills `arguments` into `format`; texts as "<private>" when `hideText`.
std::string formatLogMessage(std::string_view format, std::span<const LogArgument> arguments, bool hideText);

// The current platform's, else the installed one, else one that drops everything.
LogSink& currentLogSink();
// For programs without a Platform: once, before the first thread; the sink stays for the life of the process.
void installLogSink(LogSink& sink);

namespace detail {
template <class T>
LogArgument logArgument(T&& value) {
  using Plain = std::decay_t<T>;
  if constexpr (std::is_invocable_v<T>) {
    return logArgument(value());
  } else if constexpr (std::is_same_v<Plain, bool>) {
    return LogArgument(std::in_place_type<bool>, value);
  } else if constexpr (std::is_floating_point_v<Plain>) {
    return LogArgument(std::in_place_type<double>, value);
  } else if constexpr (std::is_integral_v<Plain> && std::is_signed_v<Plain>) {
    return LogArgument(std::in_place_type<std::int64_t>, value);
  } else if constexpr (std::is_integral_v<Plain>) {
    return LogArgument(std::in_place_type<std::uint64_t>, value);
  } else {
    return LogArgument(std::in_place_type<std::string>, std::string_view(value));
  }
}
}  // namespace detail

// One channel. An argument that costs something to make is passed as a callable, which runs only if the line
// is written. Any thread.
class Logger {
 public:
  explicit Logger(LogChannel channel_) : channel(std::move(channel_)) {}

  template <class... Arguments>
  void info(std::string_view format, Arguments&&... arguments) const {
    write(LogLevel::info, format, std::forward<Arguments>(arguments)...);
  }
  template <class... Arguments>
  void default_(std::string_view format, Arguments&&... arguments) const {
    write(LogLevel::default_, format, std::forward<Arguments>(arguments)...);
  }
  template <class... Arguments>
  void error(std::string_view format, Arguments&&... arguments) const {
    write(LogLevel::error, format, std::forward<Arguments>(arguments)...);
  }

 private:
  template <class... Arguments>
  void write(LogLevel level, std::string_view format, Arguments&&... arguments) const {
    LogSink& sink = currentLogSink();
    if (!sink.enabled(channel, level)) return;
    // One spare element: an array of none cannot be made.
    const LogArgument list[sizeof...(arguments) + 1] = {
        detail::logArgument(std::forward<Arguments>(arguments))...};
    sink.write(channel, level, format, std::span(list, sizeof...(arguments)));
  }

  const LogChannel channel;
};

// The channel of the platform's own pieces, subsystem "com.kestrel.hearth", with arguments in clear: for
// example hearthLog("files").error("%s: %s", path, reason).
Logger hearthLog(std::string_view category);

}  // namespace platform
