// What pairwellctl asks of the daemon, of hearthd and of the cloud store.
#pragma once

#include <chrono>
#include <functional>
#include <string>

#include "platform/Result.hpp"
#include "platform/Value.hpp"
#include "platform/linux/Paths.hpp"
#include "tools/Output.hpp"

namespace tools {

class Client {
 public:
  // Every question has this long for its answer.
  Client(platform::linux_::Paths paths, std::chrono::milliseconds timeout);

  // One call on a connection of its own: the daemon may have been restarted since the last.
  platform::Result<platform::List> call(const std::string& operation, const platform::List& arguments = {});

  // When the logging will end, in seconds since 1970, where the caller may read that; 0 otherwise.
  double end() const;

  // Calls `changed` at each settings-changed notification, until it fails or hearthd ends.
  std::error_code watch(const std::function<std::error_code()>& changed);

  // Says what the last question failed with.
  Exit fail(std::error_code error) const { return tools::fail(asked, error, answer); }

 private:
  const platform::linux_::Paths paths;
  const std::chrono::milliseconds timeout;
  std::string asked;   // whom
  std::string answer;  // the error that he answered, if it was that
};

}  // namespace tools
