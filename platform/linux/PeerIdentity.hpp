// Who is at the other end of a local socket.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <optional>

#include "platform/linux/UniqueDescriptor.hpp"

namespace platform::linux_ {

struct PeerIdentity {
  pid_t pid = 0;
  uid_t uid = static_cast<uid_t>(-1);
  gid_t gid = static_cast<gid_t>(-1);

  // The executable's place, or absent where it could not be established: such a peer has no entitlements.
  struct Executable {
    std::uint64_t device = 0;
    std::uint64_t inode = 0;
    friend bool operator==(const Executable&, const Executable&) = default;
  };
  std::optional<Executable> executable;
  // A pidfd of that very process: readable once it has ended.
  std::shared_ptr<const UniqueDescriptor> process;
};

// SO_PEERPIDFD: Linux 6.5 knows it, older headers do not name it.
inline constexpr int peerPidfdOption = 77;

// From the socket itself. Each system call that fails leaves its part absent; a line in the log says why.
// Where the kernel does not know `pidfdOption`, the handle is the one of the peer's pid, which is weaker.
PeerIdentity establishPeer(int socket, int pidfdOption = peerPidfdOption);

}  // namespace platform::linux_
