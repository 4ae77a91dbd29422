// 128-bit universally unique identifiers.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace platform {

class UUID {
 public:
  // A fresh random one (version 4).
  static UUID random();
  // Hyphenated hexadecimal of either case, 8-4-4-4-12 and nothing else.
  static std::optional<UUID> parse(std::string_view text);

  // Canonical: upper case, hyphenated.
  std::string text() const;

  friend auto operator<=>(const UUID&, const UUID&) = default;

 private:
  std::array<std::uint8_t, 16> bytes{};
};

}  // namespace platform
