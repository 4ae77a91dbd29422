// Real files and sockets, for tests and benchmarks that go down to them, and how they wait for what nobody
// announces.
#pragma once

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>
#include <thread>
#include <utility>

#include "platform/linux/UniqueDescriptor.hpp"

namespace fakes {

// Generous, since the machine may be busy: a condition that is met is noticed soon.
inline std::chrono::seconds deadline{30};

inline bool eventually(const std::function<bool()>& condition) {
  const auto end = std::chrono::steady_clock::now() + deadline;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > end) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return true;
}

// A folder that is gone with its owner.
struct TemporaryFolder {
  TemporaryFolder() : path(std::filesystem::temp_directory_path() / "pairwellXXXXXX") {
    if (!::mkdtemp(path.data())) std::abort();
  }
  ~TemporaryFolder() { std::filesystem::remove_all(path); }
  TemporaryFolder(const TemporaryFolder&) = delete;
  TemporaryFolder& operator=(const TemporaryFolder&) = delete;

  std::string path;
};

inline std::string contents(const std::filesystem::path& path) {
  std::ostringstream text;
  text << std::ifstream(path).rdbuf();
  return text.str();
}

// A socket that `use`, connect() or bind(), has given the address; none if that failed.
template <class Use>
platform::linux_::UniqueDescriptor socketAt(const std::string& path, Use use, int type = SOCK_STREAM) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  platform::linux_::UniqueDescriptor socket(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
  if (use(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) < 0) socket.reset();
  return socket;
}

inline sockaddr_in loopback(int port) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(static_cast<std::uint16_t>(port));
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  return address;
}

// On a port that is free, and below those that connections get: a server that is started again must find it
// free once more.
inline std::pair<platform::linux_::UniqueDescriptor, int> listening() {
  static int port = 10'000 + ::getpid() % 1'000 * 20;
  for (int attempt = 0; attempt < 1'000; ++attempt) {
    platform::linux_::UniqueDescriptor socket(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const sockaddr_in address = loopback(++port);
    if (::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 &&
        ::listen(socket.get(), 1) == 0)
      return {std::move(socket), port};
  }
  std::abort();
}
inline int freePort() { return listening().second; }

}  // namespace fakes
