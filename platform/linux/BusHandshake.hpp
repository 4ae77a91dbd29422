// The server's side of what precedes messages: the handshake, and where one message ends.
//
// The library could do the handshake itself, but reads ahead while it does so, and what it has read ahead
// escapes the bound on a message's size. So these bytes are ours, and the library gets whole messages only.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Result.hpp"

namespace platform::linux_ {

// EXTERNAL alone, for the user that the kernel names. Clients may send everything ahead of the answers.
class BusHandshake {
 public:
  BusHandshake(uid_t user, std::string serverIdentifier);

  enum class Progress { going, done, failed };
  // Takes what it understands off the front of `input` and adds the answers to `output`. After `done` the
  // rest of `input` is messages.
  Progress advance(std::string_view& input, std::string& output);

 private:
  Progress handleLine(std::string_view line, std::string& output);
  std::string authenticate(std::string_view encodedUser);

  const uid_t user;
  const std::string serverIdentifier;
  bool begun = false;
  bool dataExpected = false;
  bool authenticated = false;
  std::size_t bytes = 0;
  std::size_t lines = 0;
};

// What a client that is refused is told, whatever it sends: one line for each that clients send ahead.
inline constexpr std::string_view busRefusal =
    "REJECTED EXTERNAL\r\nREJECTED EXTERNAL\r\nREJECTED EXTERNAL\r\n";

// The length of the message that `bytes` begins with: absent while its fixed header is incomplete.
// Outcome::tooLarge; std::errc::bad_message for what is no header.
Result<std::optional<std::size_t>> busMessageLength(std::string_view bytes, std::size_t limit);

}  // namespace platform::linux_
