// Sockets that anyone on the machine may connect to.
#pragma once

#include <string>

#include "platform/Result.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

namespace hearth {

// Bound anew, in the place of whatever a predecessor left there; the caller has made sure that none lives.
platform::Result<platform::linux_::UniqueDescriptor> listenAt(const std::string& path);

}  // namespace hearth
