#include "platform/Value.hpp"

#include <charconv>
#include <cmath>
#include <limits>

namespace platform {

std::optional<Date> Date::ofSeconds(double secondsSince1970) {
  constexpr std::int64_t nanosecondsPerSecond = 1'000'000'000;
  constexpr double lastSecond = 9223372036;
  const double seconds = std::trunc(secondsSince1970);
  if (!(std::abs(seconds) <= lastSecond)) return std::nullopt;  // so that NaN is refused, too
  return Date{static_cast<std::int64_t>(seconds) * nanosecondsPerSecond};
}

bool operator==(const Value& a, const Value& b) { return a.storage == b.storage; }

std::optional<bool> toBool(const Value& value) {
  if (const auto* boolean = value.as<bool>()) return *boolean;
  if (const auto number = toInteger(value); number && (*number == 0 || *number == 1)) return *number == 1;
  return std::nullopt;
}

std::optional<std::int64_t> toInteger(const Value& value) {
  if (const auto* boolean = value.as<bool>()) return *boolean ? 1 : 0;
  if (const auto* integer = value.as<std::int64_t>()) return *integer;
  if (const auto* number = value.as<double>()) {
    // 2^63 is the first double above the range; NaN fails both comparisons.
    if (*number >= -0x1p63 && *number < 0x1p63 && std::trunc(*number) == *number) {
      return static_cast<std::int64_t>(*number);
    }
  }
  return std::nullopt;
}

std::optional<double> toDouble(const Value& value) {
  if (const auto* number = value.as<double>()) return *number;
  if (const auto integer = toInteger(value)) {
    const auto number = static_cast<double>(*integer);
    if (number < 0x1p63 && static_cast<std::int64_t>(number) == *integer) return number;
  }
  return std::nullopt;
}

std::optional<std::string> toText(const Value& value) {
  if (const auto* text = value.as<std::string>()) return *text;
  return std::nullopt;
}

std::optional<std::vector<std::string>> toTexts(const Value& value) {
  const auto* list = value.as<List>();
  if (!list) return std::nullopt;
  std::vector<std::string> texts;
  for (const Value& element : *list) {
    const auto* text = element.as<std::string>();
    if (!text) return std::nullopt;
    texts.push_back(*text);
  }
  return texts;
}

std::string describe(double value) {
  if (std::isnan(value)) return "nan";
  if (std::isinf(value)) return value < 0 ? "-inf" : "inf";
  const double magnitude = std::fabs(value);
  // Plain shortest output would write 100000.0 as 1e+05, so the notation is chosen here.
  const bool exponent = magnitude >= 1e16;
  char buffer[400];  // the least double has some 340 characters
  const auto [end, error] =
      std::to_chars(buffer, buffer + sizeof buffer, value,
                    exponent ? std::chars_format::scientific : std::chars_format::fixed);
  std::string text(buffer, end);
  if (!exponent && text.find('.') == std::string::npos) text += ".0";
  return text;
}

namespace {

std::string describeNested(const Value& value) {
  if (const auto* text = value.as<std::string>()) return '"' + *text + '"';
  return describe(value);
}

struct Describer {
  std::string operator()(std::nullptr_t) const { return "null"; }
  std::string operator()(bool value) const { return value ? "true" : "false"; }
  std::string operator()(std::int64_t value) const { return std::to_string(value); }
  std::string operator()(double value) const { return describe(value); }
  std::string operator()(const std::string& value) const { return value; }
  // As the seconds since 1970 that the rest of the log speaks in.
  std::string operator()(Date value) const { return describe(static_cast<double>(value.nanoseconds) / 1e9); }
  std::string operator()(const List& list) const {
    std::string text = "[";
    for (const Value& element : list) {
      if (text.size() > 1) text += ", ";
      text += describeNested(element);
    }
    return text + "]";
  }
  std::string operator()(const Dictionary& dictionary) const { return describe(dictionary); }
};

}  // namespace

std::string describe(const Dictionary& dictionary) {
  if (dictionary.empty()) return "[:]";
  std::string text = "[";
  for (const auto& [key, value] : dictionary) {
    if (text.size() > 1) text += ", ";
    text += '"' + key + "\": " + describeNested(value);
  }
  return text + "]";
}

std::string describe(const Value& value) { return std::visit(Describer{}, value.storage); }

std::string describe(const std::optional<Value>& value) { return value ? describe(*value) : "nil"; }

}  // namespace platform
