#include "platform/linux/BusHandshake.hpp"

#include <bit>
#include <cstdint>
#include <cstring>
#include <utility>

#include "platform/ClientLimits.hpp"

namespace platform::linux_ {
namespace {

constexpr std::string_view rejected = "REJECTED EXTERNAL\r\n";

// The rest of `line` after `word` and a space, or nothing after the word itself.
std::optional<std::string_view> argumentsOf(std::string_view line, std::string_view word) {
  if (!line.starts_with(word)) return std::nullopt;
  line.remove_prefix(word.size());
  if (line.empty()) return line;
  if (line.front() != ' ') return std::nullopt;
  return line.substr(1);
}

std::string hexadecimal(std::string_view text) {
  constexpr const char* digits = "0123456789abcdef";
  std::string encoded;
  for (const char character : text) {
    encoded += digits[static_cast<unsigned char>(character) >> 4];
    encoded += digits[static_cast<unsigned char>(character) & 15];
  }
  return encoded;
}

std::uint32_t number(std::string_view bytes, std::size_t offset, bool bigEndian) {
  std::uint32_t value;
  std::memcpy(&value, bytes.data() + offset, sizeof value);
  return bigEndian == (std::endian::native == std::endian::big) ? value : __builtin_bswap32(value);
}

}  // namespace

BusHandshake::BusHandshake(uid_t user_, std::string serverIdentifier_)
    : user(user_), serverIdentifier(std::move(serverIdentifier_)) {}

BusHandshake::Progress BusHandshake::advance(std::string_view& input, std::string& output) {
  if (!begun && !input.empty()) {
    // A zero byte, which carries credentials on systems that need it.
    if (input.front() != '\0') return Progress::failed;
    input.remove_prefix(1);
    begun = true;
  }
  for (;;) {
    const std::size_t end = input.find("\r\n");
    if (end == std::string_view::npos)
      return bytes + input.size() > limits::handshakeBytes ? Progress::failed : Progress::going;
    const std::string_view line = input.substr(0, end);
    bytes += end + 2;
    if (bytes > limits::handshakeBytes || ++lines > limits::handshakeLines) return Progress::failed;
    input.remove_prefix(end + 2);
    if (const Progress progress = handleLine(line, output); progress != Progress::going) return progress;
  }
}

BusHandshake::Progress BusHandshake::handleLine(std::string_view line, std::string& output) {
  if (line == "BEGIN") return authenticated ? Progress::done : Progress::failed;
  if (authenticated) {
    // Descriptors are among what is not offered.
    output += "ERROR\r\n";
  } else if (const auto data = argumentsOf(line, "DATA"); data && dataExpected) {
    dataExpected = false;
    output += authenticate(*data);
  } else if (const auto user_ = argumentsOf(line, "AUTH EXTERNAL")) {
    dataExpected = user_->empty();
    output += dataExpected ? "DATA\r\n" : authenticate(*user_);
  } else {
    dataExpected = false;
    const bool asks = argumentsOf(line, "AUTH") || line == "CANCEL" || argumentsOf(line, "ERROR");
    output += asks ? rejected : "ERROR\r\n";
  }
  return Progress::going;
}

std::string BusHandshake::authenticate(std::string_view encodedUser) {
  // Nothing asks for the user that the kernel names.
  authenticated = encodedUser.empty() || encodedUser == hexadecimal(std::to_string(user));
  return authenticated ? "OK " + serverIdentifier + "\r\n" : std::string(rejected);
}

Result<std::optional<std::size_t>> busMessageLength(std::string_view bytes, std::size_t limit) {
  // Byte order, type, flags, version 1; then the length of the body, a serial, the length of the header's
  // fields.
  constexpr std::size_t fixedHeader = 16;
  if (!bytes.empty() && bytes[0] != 'l' && bytes[0] != 'B')
    return std::make_error_code(std::errc::bad_message);
  if (bytes.size() < fixedHeader) return std::optional<std::size_t>();
  if (bytes[3] != 1) return std::make_error_code(std::errc::bad_message);
  const bool bigEndian = bytes[0] == 'B';
  const std::uint64_t body = number(bytes, 4, bigEndian);
  const std::uint64_t fields = number(bytes, 12, bigEndian);
  const std::uint64_t length = fixedHeader + (fields + 7) / 8 * 8 + body;
  if (length > limit) return Outcome::tooLarge;
  return std::optional<std::size_t>(length);
}

}  // namespace platform::linux_
