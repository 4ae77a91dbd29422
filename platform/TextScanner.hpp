// Reads integers and user-perceived characters off a Unicode text, from its start.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace platform {

class TextScanner {
 public:
  // `text` is UTF-8 and must outlive the scanner; an invalid byte counts as a character of its own.
  explicit TextScanner(std::string_view text) : rest(text) {}

  // One or more ASCII digits: no sign, no white space (a build that has them is not one that we know how to
  // order), nothing beyond 64 bits. A digit that carries a combining mark is another character and no digit.
  std::optional<std::int64_t> scanInteger();
  // One grapheme cluster.
  std::optional<std::string> scanCharacter();
  bool isAtEnd() const { return rest.empty(); }

 private:
  std::string_view rest;
};

}  // namespace platform
