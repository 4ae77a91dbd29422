#include "platform/TextScanner.hpp"

#include <utf8proc.h>

#include <charconv>

namespace platform {
namespace {

struct CodePoint {
  utf8proc_int32_t value;
  std::size_t length;
};

CodePoint firstCodePoint(std::string_view text) {
  utf8proc_int32_t value;
  const auto length = utf8proc_iterate(reinterpret_cast<const utf8proc_uint8_t*>(text.data()),
                                       static_cast<utf8proc_ssize_t>(text.size()), &value);
  if (length <= 0) return {0xFFFD, 1};
  return {value, static_cast<std::size_t>(length)};
}

// Bytes of the first user-perceived character; 0 at the end.
std::size_t clusterLength(std::string_view text) {
  if (text.empty()) return 0;
  CodePoint previous = firstCodePoint(text);
  std::size_t length = previous.length;
  utf8proc_int32_t state = 0;
  while (length < text.size()) {
    const CodePoint next = firstCodePoint(text.substr(length));
    if (utf8proc_grapheme_break_stateful(previous.value, next.value, &state)) break;
    length += next.length;
    previous = next;
  }
  return length;
}

}  // namespace

std::optional<std::int64_t> TextScanner::scanInteger() {
  std::size_t digits = 0;
  // A digit in a longer cluster carries a mark, and is no digit.
  while (digits < rest.size() && rest[digits] >= '0' && rest[digits] <= '9' &&
         clusterLength(rest.substr(digits)) == 1) {
    ++digits;
  }
  std::int64_t value;
  const auto [end, error] = std::from_chars(rest.data(), rest.data() + digits, value);
  if (digits == 0 || error != std::errc()) return std::nullopt;
  rest.remove_prefix(digits);
  return value;
}

std::optional<std::string> TextScanner::scanCharacter() {
  if (rest.empty()) return std::nullopt;
  const std::size_t length = clusterLength(rest);
  std::string character(rest.substr(0, length));
  rest.remove_prefix(length);
  return character;
}

}  // namespace platform
