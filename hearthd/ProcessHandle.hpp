// Pidfds, which stand for one process, never for a later one of the same number.
#pragma once

#include <sys/syscall.h>
#include <sys/types.h>
#include <unistd.h>

#include "platform/linux/UniqueDescriptor.hpp"

namespace hearth {

// As bare system calls: glibc's header declares its functions for C alone.
inline platform::linux_::UniqueDescriptor openProcess(pid_t pid) {
  return platform::linux_::UniqueDescriptor(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
}

// 0, or -1 with errno set.
inline long signalProcess(const platform::linux_::UniqueDescriptor& process, int signal) {
  return ::syscall(SYS_pidfd_send_signal, process.get(), signal, nullptr, 0);
}

}  // namespace hearth
