// What pairwellctl asks of the daemon, of hearthd and of the cloud store.
#pragma once

#include <chrono>
#include <functional>
#include <string>

#include "platform/Result.hpp"
#include "platform/Value.hpp"
#include "platform/linux/BusClient.hpp"
#include "platform/linux/Paths.hpp"

namespace pairwellctl {

class Client {
 public:
  // Every question has this long for its answer.
  Client(platform::linux_::Paths paths, std::chrono::milliseconds timeout);

  // One call on a connection of its own: the daemon may have been restarted since the last. `what` gets the
  // service that failed, for a message.
  platform::Result<platform::List> call(const std::string& operation, const platform::List& arguments,
                                        std::string& what) const;

  // When the logging will end, in seconds since 1970, where the caller may read that; 0 otherwise.
  double end() const;

  // Calls `changed` at each settings-changed notification until it fails, or hearthd ends.
  std::error_code watch(const std::function<std::error_code()>& changed, std::string& what) const;

 private:
  const platform::linux_::Paths paths;
  const std::chrono::milliseconds timeout;
};

}  // namespace pairwellctl
