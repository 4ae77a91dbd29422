// Three nats-servers on this machine, each with ports and a folder of its own.
#pragma once

#include <sys/types.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "bench/Process.hpp"
#include "platform/Value.hpp"
#include "tests/fakes/RealFiles.hpp"

namespace bench {

// Configured as packaging/nats shows, but unencrypted: what is measured is the engine, not its TLS.
class Cluster {
 public:
  static constexpr std::size_t size = 3;

  // With the engine's accounts a0, a1, …: each with a user of its name. Returns when streams can be made.
  explicit Cluster(std::size_t accounts = 1);
  void start(std::size_t number);
  void kill(std::size_t number);                 // as a crash does
  pid_t process(std::size_t number) const;       // -1 once it is killed
  std::string folder(std::size_t number) const;  // of its streams

  static std::string account(std::size_t number) { return "a" + std::to_string(number); }
  static std::string stream(std::size_t number) { return "pairwell-" + account(number); }
  static std::string password() { return "p"; }
  std::string address(std::size_t number) const;
  // Of hearthctl init, for a device in account a0.
  std::string initOptions() const;

  // What a server's monitor says at `path`; a server that does not answer says {}.
  platform::Dictionary look(std::size_t number, const std::string& path) const;
  // A count at the top of that, such as varz's "connections".
  std::int64_t count(std::size_t number, const std::string& path, const std::string& field) const;
  std::vector<std::string> streamsLedBy(std::size_t number) const;
  std::optional<std::size_t> leaderOf(const std::string& stream) const;

 private:
  struct Server {
    const int port = fakes::freePort(), cluster = fakes::freePort(), monitor = fakes::freePort();
    std::optional<Child> process;
  };
  void configure(std::size_t accounts);
  bool isReady() const;

  const fakes::TemporaryFolder root;
  std::array<Server, size> servers;
};

}  // namespace bench
