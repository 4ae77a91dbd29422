// What one client may take from a BusServer, so that no client costs the others theirs.
#pragma once

#include <chrono>
#include <cstddef>

namespace platform::linux_::limits {

// Each connection takes four descriptors (socket, the two ends that feed the library, the peer's process) and
// some 20 KiB in all; a machine's clients are a few dozen.
inline constexpr std::size_t connections = 4096;
// One user's leak or attack leaves three quarters to the others.
inline constexpr std::size_t connectionsPerUser = 1024;

// The largest call of a sound client is a few hundred bytes; the library itself would buffer 128 MiB.
inline constexpr std::size_t messageBytes = 16 * 1024;
// A handshake is about 100 bytes in four lines.
inline constexpr std::size_t handshakeBytes = 1024;
inline constexpr std::size_t handshakeLines = 16;

// Libraries send their handshake at once; a process that is stopped for longer has to connect anew.
inline constexpr std::chrono::seconds handshakeTime{5};
// How long a refused client is listened to, so that its late bytes do not turn the refusal into a broken
// pipe.
inline constexpr std::chrono::seconds refusalTime{5};
// How long a begun message may stay incomplete, or output unread, without a byte moving.
inline constexpr std::chrono::seconds stallTime{10};

// Calls unanswered and messages unsent together: reading stops there, which slows the client down and is no
// error. What a client that never reads can hold is this many answers, and one signal a merge key.
inline constexpr std::size_t outstanding = 16;

// One turn of the loop reads this much of a client, then the others have theirs.
inline constexpr std::size_t bytesPerTurn = 16 * 1024;
// At the descriptor limit the listener rests this long, or until a connection ends.
inline constexpr std::chrono::milliseconds acceptPause{500};

}  // namespace platform::linux_::limits
