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
using platform::Value;

namespace {

void checkScanner(std::string_view text) {
  platform::TextScanner scanner(text);
  std::size_t taken = 0;
  while (!scanner.isAtEnd()) {
    if (scanner.scanInteger()) {
      ++taken;
    } else {
      taken += scanner.scanCharacter()->size();
    }
  }
  fuzz::require(taken <= text.size() && (taken > 0 || text.empty()));
}

void checkVersion(std::string_view text) {
  const auto version = pairwell::SystemVersionNumber::fromString(text);
  if (!version) return;
  fuzz::require(version->rawValue == text && !(*version < *version) && !version->description().empty());
  fuzz::require(pairwell::SystemVersionNumber::decode(version->encode()).value() == *version);
  // As it is recorded at a launch.
  const auto recorded = pairwell::SystemVersionNumber::fromString(version->description());
  fuzz::require(recorded && recorded->baseNumber == version->baseNumber);
}

void checkNumber(double number) {
  if (number == number) fuzz::require(std::strtod(platform::describe(number).c_str(), nullptr) == number);
  const auto integer = platform::toInteger(number);
  if (integer) fuzz::require(static_cast<double>(*integer) == number);
  static_cast<void>(platform::Date::ofSeconds(number));
}

void checkValue(std::string_view text) {
  std::string problem;
  const auto value = linux_::parseJson(text, problem);
  fuzz::require(value || problem.starts_with("line "));
  if (!value) return;
  for (const auto style : {linux_::JsonStyle::line, linux_::JsonStyle::indented}) {
    const auto printed = linux_::printJson(*value, style);
    fuzz::require(printed && *linux_::printJson(*linux_::parseJson(*printed, problem), style) == *printed);
  }
  static_cast<void>(platform::describe(*value));
  if (const auto number = platform::toDouble(*value)) checkNumber(*number);
  if (const auto truth = platform::toBool(*value))
    fuzz::require(platform::toInteger(*value) == (*truth ? 1 : 0));
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const auto text = fuzz::textOf(data, size);
  checkScanner(text);
  checkVersion(text);
  if (const auto uuid = platform::UUID::parse(text))
    fuzz::require(platform::UUID::parse(uuid->text()) == uuid);
  checkValue(text);
  double number = 0;
  std::memcpy(&number, data, std::min(size, sizeof number));
  checkNumber(number);
  return 0;
}
