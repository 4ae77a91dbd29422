// Who holds the lock that proves that a job lives, whoever started it.
#pragma once

#include <string>
#include <vector>

#include "platform/linux/UniqueDescriptor.hpp"

namespace hearth {

// Kills all other processes that have the file at `path` open, and returns their pidfds: each is readable
// once its process has ended.
//
// They are found by what they hold, not by a recorded pid: that would have to be written after the fork, a
// kill in between would leave an orphan that nobody knows, and the pid may be another's by now.
std::vector<platform::linux_::UniqueDescriptor> endHolders(const std::string& path);

}  // namespace hearth
