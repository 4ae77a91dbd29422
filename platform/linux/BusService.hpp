// What a BusServer's sessions share: what is served, and how the library is told.
#pragma once

#include <string>
#include <vector>

#include "platform/ClientLimits.hpp"
#include "platform/linux/BusServer.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

struct sd_bus;
struct sd_bus_vtable;

namespace platform::linux_ {

class BusSession;

struct BusService {
  BusService(BusInterface interface, limits::Patience patience);
  ~BusService();

  // Makes the library's bus of `session`, as a server on these two; the session and this object outlive it.
  // Less than 0 is an error number's opposite, as the library has it.
  int open(BusSession& session, UniqueDescriptor in, UniqueDescriptor out, sd_bus*& bus) const;

  const BusInterface interface;
  const limits::Patience patience;
  const std::vector<sd_bus_vtable> table;  // of `interface`, whose texts it points to
  const std::string identifier;            // of the server, in handshakes
};

}  // namespace platform::linux_
