// Version numbers, the scanner below them, and property values.
#include <string>

#include "fuzz/Target.hpp"
#include "pairwelld/SystemVersionNumber.hpp"
#include "platform/TextScanner.hpp"
#include "platform/Value.hpp"
#include "platform/linux/Json.hpp"

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const auto text = fuzz::textOf(data, size);
  platform::TextScanner scanner(text);
  for (std::size_t steps = 0; !scanner.isAtEnd(); ++steps) {
    fuzz::require(steps < size);  // each takes something
    if (!scanner.scanInteger()) fuzz::require(scanner.scanCharacter().has_value());
  }
  if (const auto version = pairwell::SystemVersionNumber::fromString(text)) {
    fuzz::require(version->rawValue == text);
    fuzz::require(pairwell::SystemVersionNumber::decode(version->encode()).has_value());
    fuzz::require(!version->description().empty() && !(*version < *version));
  }
  std::string problem;
  if (const auto value = platform::linux_::parseJson(text, problem)) {
    for (const platform::Value& each : {*value, platform::Value(std::string(text))}) {
      static_cast<void>(platform::toInteger(each));
      static_cast<void>(platform::toDouble(each));
      static_cast<void>(platform::toBool(each));
      static_cast<void>(platform::toText(each));
      fuzz::require(!platform::describe(each).empty() || text == "\"\"");
    }
  }
  return 0;
}
