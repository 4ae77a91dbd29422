// Messages by hand, for tests and benchmarks that go down to their bytes.
#pragma once

#include <algorithm>
#include <bit>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace fakes {

// A client's whole handshake, as libraries send it ahead.
inline constexpr std::string_view handshakeAhead{"\0AUTH EXTERNAL\r\nDATA\r\nBEGIN\r\n", 29};

// As they stand in messages.
inline std::string number(std::uint32_t value, std::endian order = std::endian::native) {
  std::string bytes(reinterpret_cast<const char*>(&value), sizeof value);
  if (order != std::endian::native) std::reverse(bytes.begin(), bytes.end());
  return bytes;
}
inline std::string text(const std::string& value, std::endian order = std::endian::native) {
  return number(static_cast<std::uint32_t>(value.size()), order) + value + '\0';
}
inline void align(std::string& bytes, std::size_t to) { bytes.resize((bytes.size() + to - 1) / to * to); }

// A field of a header, by its code; `value` as it stands there.
inline void addField(std::string& fields, char code, char type, const std::string& value) {
  align(fields, 8);
  fields += std::string{code, 1, type, 0} + value;
}
inline std::string signature(const std::string& types) {
  return static_cast<char>(types.size()) + types + '\0';
}

// `kind`: 1 is a call, 2 its answer, 3 an error, 4 a signal.
inline std::string busMessage(char kind, const std::string& fields, const std::string& body,
                              std::uint32_t serial = 1, std::endian order = std::endian::native) {
  std::string message{order == std::endian::big ? 'B' : 'l', kind, 0, 1};
  message += number(static_cast<std::uint32_t>(body.size()), order) + number(serial, order) +
             number(static_cast<std::uint32_t>(fields.size()), order) + fields;
  align(message, 8);
  return message + body;
}

}  // namespace fakes
