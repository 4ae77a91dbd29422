// The descriptors that the service manager hands a job: LISTEN_FDS, with names.
#pragma once

#include <string_view>

#include "platform/linux/UniqueDescriptor.hpp"

namespace platform::linux_ {

// The inherited descriptor called `name`, or none. Each is given out once. Any thread.
UniqueDescriptor takeInheritedDescriptor(std::string_view name);
// Whether there is one of that name which nobody has taken.
bool hasInheritedDescriptor(std::string_view name);

}  // namespace platform::linux_
