// Version numbers, the scanner below them, identifiers, and property values.
#include <cstdlib>
#include <cstring>
#include <string>

#include "fuzz/Target.hpp"
#include "pairwelld/SystemVersionNumber.hpp"
#include "platform/TextScanner.hpp"
#include "platform/UUID.hpp"
#include "platform/Value.hpp"
#include "platform/linux/Json.hpp"

namespace linux_ = platform::linux_;

namespace {

void checkVersion(std::string_view text) {
  platform::TextScanner scanner(text);
  for (std::size_t steps = 0; !scanner.isAtEnd(); ++steps) {
    fuzz::require(steps < text.size());  // each takes something
    if (!scanner.scanInteger()) fuzz::require(scanner.scanCharacter().has_value());
  }
  const auto version = pairwell::SystemVersionNumber::fromString(text);
  if (!version) return;
  fuzz::require(version->rawValue == text && !(*version < *version));
  // As it is recorded at a launch.
  const auto recorded = pairwell::SystemVersionNumber::fromString(version->description());
  fuzz::require(recorded && recorded->baseNumber == version->baseNumber);
}

void checkNumber(double number) {
  const bool isOne = number == number;
  fuzz::require(!isOne || std::strtod(platform::describe(number).c_str(), nullptr) == number);
  const auto integer = platform::toInteger(number);
  fuzz::require(!integer || static_cast<double>(*integer) == number);
  static_cast<void>(platform::Date::ofSeconds(number));
}

void checkValue(std::string_view text) {
  std::string problem;
  const auto value = linux_::parseJson(text, problem);
  fuzz::require(value || problem.starts_with("line "));
  if (!value) return;
  const auto printed = linux_::printJson(*value, linux_::JsonStyle::line);
  const auto again = linux_::parseJson(*printed, problem);
  fuzz::require(again && *linux_::printJson(*again, linux_::JsonStyle::line) == *printed);
  static_cast<void>(platform::describe(*value));
  if (const auto number = platform::toDouble(*value)) checkNumber(*number);
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const auto text = fuzz::textOf(data, size);
  checkVersion(text);
  checkValue(text);
  const auto uuid = platform::UUID::parse(text);
  fuzz::require(!uuid || platform::UUID::parse(uuid->text()) == uuid);
  double number = 0;
  std::memcpy(&number, data, std::min(size, sizeof number));
  checkNumber(number);
  return 0;
}
