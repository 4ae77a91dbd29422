#include "pairwelld/SystemVersionNumber.hpp"

#include <system_error>
#include <utility>

#include "platform/Platform.hpp"
#include "platform/TextScanner.hpp"

namespace pairwell {
namespace {

// Build numbers from here on carry a childType in their thousands.
constexpr std::int64_t childTypeUnit = 1000;

}  // namespace

SystemVersionNumber::SystemVersionNumber(std::string_view text, std::int64_t baseNumber_,
                                         std::string baseLetter_, std::int64_t number,
                                         std::optional<std::string> suffix_)
    : rawValue(text),
      baseNumber(baseNumber_),
      baseLetter(std::move(baseLetter_)),
      childType(number < childTypeUnit ? std::nullopt : std::optional(number / childTypeUnit)),
      buildNumber(number % childTypeUnit),
      suffix(std::move(suffix_)) {}

std::optional<SystemVersionNumber> SystemVersionNumber::fromString(std::string_view text) {
  platform::TextScanner scanner(text);
  const auto baseNumber = scanner.scanInteger();
  if (!baseNumber) return std::nullopt;
  auto baseLetter = scanner.scanCharacter();
  if (!baseLetter) return std::nullopt;
  const auto number = scanner.scanInteger();
  if (!number) return std::nullopt;
  auto suffix = scanner.scanCharacter();
  if (!scanner.isAtEnd()) return std::nullopt;
  return SystemVersionNumber(text, *baseNumber, std::move(*baseLetter), *number, std::move(suffix));
}

platform::Result<SystemVersionNumber> SystemVersionNumber::decode(const platform::Value& value) {
  const auto text = platform::toText(value);
  auto version = text ? fromString(*text) : std::nullopt;
  if (!version) return std::make_error_code(std::errc::bad_message);
  return *version;
}

std::string SystemVersionNumber::description() const {
  return std::to_string(baseNumber) + baseLetter + (childType ? std::to_string(*childType) : "") +
         std::to_string(buildNumber) + suffix.value_or("");
}

// UTF-8 compared byte by byte is ordered by code point.
bool operator<(const SystemVersionNumber& a, const SystemVersionNumber& b) {
  if (a.baseNumber != b.baseNumber) return a.baseNumber < b.baseNumber;
  if (a.baseLetter != b.baseLetter) return a.baseLetter < b.baseLetter;
  if (a.buildNumber != b.buildNumber) return a.buildNumber < b.buildNumber;
  return a.suffix.value_or("") < b.suffix.value_or("");
}

SystemVersionNumber operator""_osVersion(const char* text, std::size_t length) {
  const std::string_view literal(text, length);
  auto version = SystemVersionNumber::fromString(literal);
  if (!version) platform::stop("not an OS version: " + std::string(literal));
  return *version;
}

}  // namespace pairwell
