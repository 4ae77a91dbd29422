#include "platform/linux/ProcessLock.hpp"

#include <fcntl.h>
#include <sys/file.h>

#include <cerrno>

namespace platform::linux_ {

Result<UniqueDescriptor> takeLock(const std::string& path) {
  constexpr int flags = O_RDONLY | O_CREAT | O_CLOEXEC | O_NONBLOCK;
  UniqueDescriptor file(retried([&] { return ::open(path.c_str(), flags, 0600); }));
  if (!file) return lastError();
  if (retried([&] { return ::flock(file.get(), LOCK_EX | LOCK_NB); }) == 0) return file;
  if (errno == EWOULDBLOCK) return UniqueDescriptor();
  return lastError();
}

}  // namespace platform::linux_
