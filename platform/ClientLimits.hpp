// What local clients may take, so that none costs the others theirs.
#pragma once

#include <chrono>
#include <cstddef>

namespace platform::limits {

// Each connection takes some 20 KiB and four descriptors: its socket and the peer's process, and, once it is
// through its handshake, the two ends that feed the library. A machine's clients are a few dozen.
inline constexpr std::size_t connections = 4096;
inline constexpr std::size_t descriptorsPerConnection = 4;
// One user's leak or attack leaves three quarters to the others, also of what the process's descriptors are
// enough for, where these are few.
inline constexpr std::size_t usersShare = 4;

// The largest call of a sound client is a few hundred bytes; the library itself would buffer 128 MiB.
inline constexpr std::size_t messageBytes = 16 * 1024;
// A handshake is about 100 bytes in four lines.
inline constexpr std::size_t handshakeBytes = 1024;
inline constexpr std::size_t handshakeLines = 16;

// How long clients are waited for; only tests are more impatient.
struct Patience {
  // Libraries send their handshake at once; a process that is stopped for longer has to connect anew.
  std::chrono::milliseconds handshake{5000};
  // A refused client is listened to, so that its late bytes do not turn the refusal into a broken pipe.
  std::chrono::milliseconds refusal{5000};
  // For the whole of a begun message, and for each unread one to move on.
  std::chrono::milliseconds stall{10'000};
  // At the descriptor limit the listener rests, this long or until a connection ends.
  std::chrono::milliseconds accept{500};
};

// Calls unanswered and messages unsent together: reading stops there, which slows the client down and is no
// error. What a client that never reads can hold is this many answers, and one signal a merge key.
inline constexpr std::size_t outstanding = 16;

// One turn of the loop reads this much of a client, then the others have theirs.
inline constexpr std::size_t bytesPerTurn = 16 * 1024;
// Left free when clients are accepted, beside what those in their handshake will take: the process has files
// to open, and a client that is accepted with the last one could only be refused.
inline constexpr std::size_t spareDescriptors = 64;

// At hearthd anyone may watch named notifications: names are a few dozen bytes, and whoever watches knows a
// handful.
inline constexpr std::size_t watchedNames = 64;
inline constexpr std::size_t nameBytes = 255;

}  // namespace platform::limits
