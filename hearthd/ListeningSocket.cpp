#include "hearthd/ListeningSocket.hpp"

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <system_error>

namespace hearth {

platform::Result<platform::linux_::UniqueDescriptor> listenAt(const std::string& path) {
  using platform::linux_::lastError;
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) return std::make_error_code(std::errc::filename_too_long);
  std::memcpy(address.sun_path, path.c_str(), path.size());
  platform::linux_::UniqueDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!socket) return lastError();
  if (::unlink(path.c_str()) < 0 && errno != ENOENT) return lastError();
  if (::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) < 0)
    return lastError();
  // Who may do what is settled at each accept, not by the file's mode.
  if (::chmod(path.c_str(), 0666) < 0) return lastError();
  if (::listen(socket.get(), SOMAXCONN) < 0) return lastError();
  return socket;
}

}  // namespace hearth
