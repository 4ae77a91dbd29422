#include "platform/UUID.hpp"

#include <random>

namespace platform {
namespace {

constexpr std::size_t textLength = 36;

bool isHyphenPlace(std::size_t place) { return place == 8 || place == 13 || place == 18 || place == 23; }

std::optional<unsigned> hexDigit(char character) {
  if (character >= '0' && character <= '9') return static_cast<unsigned>(character - '0');
  if (character >= 'a' && character <= 'f') return static_cast<unsigned>(character - 'a' + 10);
  if (character >= 'A' && character <= 'F') return static_cast<unsigned>(character - 'A' + 10);
  return std::nullopt;
}

}  // namespace

UUID UUID::random() {
  thread_local std::random_device device;
  UUID uuid;
  for (auto& byte : uuid.bytes) byte = static_cast<std::uint8_t>(device());
  uuid.bytes[6] = static_cast<std::uint8_t>((uuid.bytes[6] & 0x0fu) | 0x40u);
  uuid.bytes[8] = static_cast<std::uint8_t>((uuid.bytes[8] & 0x3fu) | 0x80u);
  return uuid;
}

std::optional<UUID> UUID::parse(std::string_view text) {
  if (text.size() != textLength) return std::nullopt;
  UUID uuid;
  std::size_t digits = 0;
  for (std::size_t place = 0; place < textLength; ++place) {
    if (isHyphenPlace(place)) {
      if (text[place] != '-') return std::nullopt;
      continue;
    }
    const auto digit = hexDigit(text[place]);
    if (!digit) return std::nullopt;
    auto& byte = uuid.bytes[digits / 2];
    byte = static_cast<std::uint8_t>(unsigned{byte} << 4 | *digit);
    ++digits;
  }
  return uuid;
}

std::string UUID::text() const {
  std::string text;
  for (const std::uint8_t byte : bytes) {
    if (isHyphenPlace(text.size())) text += '-';
    text += "0123456789ABCDEF"[byte >> 4];
    text += "0123456789ABCDEF"[byte & 15];
  }
  return text;
}

}  // namespace platform
