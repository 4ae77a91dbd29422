#include "platform/LogSink.hpp"

#include <cstdio>

namespace platform {
namespace {

std::string fixedSixDigits(double value) {
  char buffer[400];  // the greatest double has 309 digits before its point
  const int length = std::snprintf(buffer, sizeof buffer, "%f", value);
  return std::string(buffer, static_cast<std::size_t>(length));
}

struct ArgumentText {
  bool hideText;
  std::string operator()(const std::string& text) const { return hideText ? "<private>" : text; }
  std::string operator()(std::int64_t number) const { return std::to_string(number); }
  std::string operator()(std::uint64_t number) const { return std::to_string(number); }
  std::string operator()(double number) const { return fixedSixDigits(number); }
  std::string operator()(bool value) const { return value ? "true" : "false"; }
};

// The placeholder at the start of `text`, or 0.
std::size_t placeholderLength(std::string_view text) {
  for (const std::string_view placeholder : {"%s", "%d", "%u", "%f", "%{bool}d"}) {
    if (text.substr(0, placeholder.size()) == placeholder) return placeholder.size();
  }
  return 0;
}

}  // namespace

std::string formatLogMessage(std::string_view format, std::span<const LogArgument> arguments, bool hideText) {
  std::string message;
  std::size_t next = 0;
  while (!format.empty()) {
    const std::size_t length = placeholderLength(format);
    if (length > 0 && next < arguments.size()) {
      message += std::visit(ArgumentText{hideText}, arguments[next++]);
      format.remove_prefix(length);
    } else {
      message += format.front();
      format.remove_prefix(1);
    }
  }
  return message;
}

Logger hearthLog(std::string_view category) {
  return Logger({"com.kestrel.hearth", std::string(category), false});
}

}  // namespace platform
