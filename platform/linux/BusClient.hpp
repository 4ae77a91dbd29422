// A blocking client of a BusServer, for command-line tools. One thread.
#pragma once

#include <chrono>
#include <memory>
#include <optional>
#include <string>

#include "platform/Result.hpp"
#include "platform/linux/BusServer.hpp"

struct sd_bus;

namespace platform::linux_ {

class BusClient {
 public:
  // Connects to the socket at `path` and authenticates. Outcome::notPermitted when refused,
  // Outcome::notConnected when nobody serves it, std::errc::permission_denied when the file system does not
  // let us there, Outcome::timedOut.
  static Result<std::unique_ptr<BusClient>> connect(const std::string& path,
                                                    std::chrono::milliseconds timeout);
  ~BusClient();

  // Signatures are D-Bus notation. Outcomes as above; an error that the service answered is a BusError.
  Result<BusReply> call(const BusInterface& interface, const std::string& operation, const List& arguments,
                        std::chrono::milliseconds timeout);

  struct Signal {
    std::string name;
    List arguments;
  };
  // The next signal; absent at the end of the time, Outcome::notConnected when the connection has ended. No
  // timeout waits for ever.
  Result<std::optional<Signal>> nextSignal(std::optional<std::chrono::milliseconds> timeout);

 private:
  explicit BusClient(sd_bus* bus);
  sd_bus* const bus;
};

}  // namespace platform::linux_
