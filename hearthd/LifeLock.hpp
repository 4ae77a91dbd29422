// The lock that proves that a job lives, whoever started it.
#pragma once

#include <string>
#include <vector>

#include "platform/Result.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

namespace hearth {

// Locks the file at `path`, made if need be, with a descriptor that a child may inherit. No descriptor: it is
// locked already. Whoever inherited the descriptor holds the lock until the last copy of it is closed,
// however hung.
platform::Result<platform::linux_::UniqueDescriptor> takeLock(const std::string& path);

// Kills all other processes that have the file at `path` open, and returns their pidfds: each is readable
// once its process has ended.
//
// They are found by what they hold, not by a recorded pid: that would have to be written after the fork, a
// kill in between would leave an orphan that nobody knows, and the pid may be another's by now.
std::vector<platform::linux_::UniqueDescriptor> endHolders(const std::string& path);

}  // namespace hearth
