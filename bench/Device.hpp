// A device under a temporary root, with hearthd running.
#pragma once

#include <sys/types.h>

#include <memory>
#include <string>

#include "pairwelld/Names.hpp"
#include "platform/linux/BusClient.hpp"
#include "platform/linux/Paths.hpp"

namespace bench {

class Device {
 public:
  // `programs` is the folder of the built programs; they are copied into the root, so that their owner and
  // mode serve the entitlement files. `benchmark` is this program: it is granted the client's entitlement.
  explicit Device(const std::string& programs, const std::string& benchmark);
  ~Device();  // ends hearthd and removes the root

  void start();
  void stop();

  pid_t hearthd() const { return pid; }
  pid_t pairwelld() const;
  const platform::linux_::Paths& paths() const { return _paths; }
  std::string clientSocket() const { return _paths.serviceSocket(pairwell::names::service); }
  // Connected and authenticated, trying until it is served.
  std::unique_ptr<platform::linux_::BusClient> client() const;

 private:
  std::string root;
  platform::linux_::Paths _paths;
  pid_t pid = -1;
};

}  // namespace bench
