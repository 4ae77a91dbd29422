// A lock that lasts as long as a process.
#pragma once

#include <string>

#include "platform/Result.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

namespace platform::linux_ {

// Locks the file at `path`, made if need be, with a descriptor that a child may inherit. No descriptor: it is
// locked already. Whoever inherited the descriptor holds the lock until the last copy of it is closed,
// however hung.
Result<UniqueDescriptor> takeLock(const std::string& path);

}  // namespace platform::linux_
