// Build versions of the operating system, such as 21A5248v.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Result.hpp"
#include "platform/Value.hpp"

namespace pairwell {

// Equality looks at the raw text alone, the order at the components without childType: two values may differ
// though neither is less.
class SystemVersionNumber {
 public:
  const std::string rawValue;
  const std::int64_t baseNumber;
  // One user-perceived character each, of any kind.
  const std::string baseLetter;
  const std::optional<std::int64_t> childType;
  const std::int64_t buildNumber;
  const std::optional<std::string> suffix;

  static std::optional<SystemVersionNumber> fromString(std::string_view text);
  static std::optional<SystemVersionNumber> fromRawValue(std::string_view text) { return fromString(text); }
  // As a single text value, the raw one.
  static platform::Result<SystemVersionNumber> decode(const platform::Value& value);
  platform::Value encode() const { return platform::Value(rawValue); }

  // Leading zeros behind a childType are lost: 19A5007 prints as 19A57.
  std::string description() const;

  friend bool operator==(const SystemVersionNumber& a, const SystemVersionNumber& b) {
    return a.rawValue == b.rawValue;
  }
  friend bool operator<(const SystemVersionNumber& a, const SystemVersionNumber& b);
  friend bool operator>(const SystemVersionNumber& a, const SystemVersionNumber& b) { return b < a; }
  friend bool operator<=(const SystemVersionNumber& a, const SystemVersionNumber& b) { return !(b < a); }
  friend bool operator>=(const SystemVersionNumber& a, const SystemVersionNumber& b) { return !(a < b); }

 private:
  SystemVersionNumber(std::string_view text, std::int64_t baseNumber_, std::string baseLetter_,
                      std::int64_t number, std::optional<std::string> suffix_);
};

// Stops the process when the text does not parse.
SystemVersionNumber operator""_osVersion(const char* text, std::size_t length);

}  // namespace pairwell
