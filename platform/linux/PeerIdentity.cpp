#include "platform/linux/PeerIdentity.hpp"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <string>
#include <utility>

#include "platform/LogSink.hpp"
#include "platform/Result.hpp"

namespace platform::linux_ {
namespace {

void warn(const char* step, int error) {
  hearthLog("peer").error("%s: %s", std::string(step), std::string(std::strerror(error)));
}

UniqueDescriptor openProcess(int socket, pid_t pid, int pidfdOption) {
  int descriptor = -1;
  socklen_t size = sizeof descriptor;
  if (::getsockopt(socket, SOL_SOCKET, pidfdOption, &descriptor, &size) == 0)
    return UniqueDescriptor(descriptor);
  if (errno != ENOPROTOOPT) return UniqueDescriptor();
  static std::atomic<bool> said{false};
  if (!said.exchange(true)) warn("peers are told by pid alone, the kernel gives no handle", ENOPROTOOPT);
  return UniqueDescriptor(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
}

Result<PeerIdentity::Executable> executableOf(pid_t pid) {
  const std::string path = "/proc/" + std::to_string(pid);
  const UniqueDescriptor folder(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!folder) return lastError();
  const UniqueDescriptor file(::openat(folder.get(), "exe", O_PATH | O_CLOEXEC));
  struct stat place {};
  if (!file || ::fstat(file.get(), &place) != 0) return lastError();
  return PeerIdentity::Executable{place.st_dev, place.st_ino};
}

// Without the right to look at other users' processes this fails for every client of theirs: said once.
void warnOfExecutable(std::error_code error) {
  static std::atomic<bool> said{false};
  if (error == std::errc::permission_denied && said.exchange(true)) return;
  warn("the peer's executable", error.value());
}

bool isAlive(int process) {
  pollfd entry{process, POLLIN, 0};
  return ::poll(&entry, 1, 0) == 0;
}

}  // namespace

PeerIdentity establishPeer(int socket, int pidfdOption) {
  PeerIdentity peer;
  ucred credentials{};
  socklen_t size = sizeof credentials;
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0) {
    warn("SO_PEERCRED", errno);
    return peer;
  }
  peer.pid = credentials.pid;
  peer.uid = credentials.uid;
  peer.gid = credentials.gid;
  UniqueDescriptor process = openProcess(socket, peer.pid, pidfdOption);
  if (!process) {
    warn("no handle on the peer's process", errno);
    return peer;
  }
  peer.process = std::make_shared<const UniqueDescriptor>(std::move(process));
  const auto executable = executableOf(peer.pid);
  if (!executable) {
    warnOfExecutable(executable.error());
    return peer;
  }
  // Last: only a process that still lives makes what /proc said under its pid its own.
  if (isAlive(peer.process->get())) peer.executable = *executable;
  return peer;
}

}  // namespace platform::linux_
