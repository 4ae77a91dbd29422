// A device under a temporary root, with hearthd running.
#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "bench/Client.hpp"
#include "bench/Process.hpp"
#include "pairwelld/Names.hpp"
#include "platform/linux/BusClient.hpp"
#include "platform/linux/Paths.hpp"
#include "tests/fakes/RealFiles.hpp"

namespace bench {

class Device {
 public:
  // `programs` is the folder of the built programs; they are copied into the root, so that their owner and
  // mode serve the entitlement files. This program is granted the client's entitlement.
  // `options` are further ones of hearthctl init.
  explicit Device(const std::string& programs, const std::string& options = "");
  ~Device();  // ends hearthd

  void start();
  void stop();

  pid_t hearthd() const { return process->pid(); }
  // The process of a job, by the program's name; once it runs.
  pid_t job(const std::string& program) const;
  const platform::linux_::Paths& paths() const { return _paths; }
  Service service() const;         // pairwelld's
  Service hearthdService() const;  // hearthd's
  // Connected and authenticated, trying until it is served.
  std::unique_ptr<platform::linux_::BusClient> client() const {
    return connect(_paths.serviceSocket(pairwell::names::service));
  }
  std::unique_ptr<platform::linux_::BusClient> hearthdClient() const {
    return connect(_paths.hearthdSocket());
  }

 private:
  static std::unique_ptr<platform::linux_::BusClient> connect(const std::string& socket);

  const fakes::TemporaryFolder root;
  platform::linux_::Paths _paths;
  std::optional<Child> process;
};

// A call that fails ends the benchmark; `client` is one of pairwelld's, or of hearthd's.
platform::List call(platform::linux_::BusClient& client, const platform::linux_::BusInterface& interface,
                    const std::string& operation, const platform::List& arguments = {});
const platform::linux_::BusInterface& clientInterface();
void watch(platform::linux_::BusClient& client, std::string_view notification);
void awaitSignal(platform::linux_::BusClient& client);

}  // namespace bench
