// Enumerations whose cases have texts that are stored or compared: one table a type serves all directions.
#pragma once

#include <array>
#include <cstddef>
#include <optional>
#include <string_view>
#include <system_error>
#include <utility>

#include "platform/Result.hpp"
#include "platform/Value.hpp"

namespace platform {

template <class Case, std::size_t count>
using RawValues = std::array<std::pair<Case, std::string_view>, count>;

// Specialised beside each such enumeration, in declaration order.
template <class Case>
inline constexpr RawValues<Case, 0> rawValues{};

template <class Case>
constexpr std::string_view rawValue(Case value) {
  for (const auto& [candidate, text] : rawValues<Case>) {
    if (candidate == value) return text;
  }
  return {};
}

// The exact text, case-sensitive.
template <class Case>
constexpr std::optional<Case> fromRawValue(std::string_view text) {
  for (const auto& [value, candidate] : rawValues<Case>) {
    if (candidate == text) return value;
  }
  return std::nullopt;
}

template <class Case>
constexpr auto allCases() {
  std::array<Case, rawValues<Case>.size()> cases{};
  std::size_t index = 0;
  for (const auto& named : rawValues<Case>) cases[index++] = named.first;
  return cases;
}

template <class Case>
Value encode(Case value) {
  return Value(rawValue(value));
}

template <class Case>
Result<Case> decode(const Value& value) {
  const auto text = toText(value);
  const auto decoded = text ? fromRawValue<Case>(*text) : std::nullopt;
  if (!decoded) return std::make_error_code(std::errc::bad_message);
  return *decoded;
}

}  // namespace platform
