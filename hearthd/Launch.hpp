// Starts a program as a job.
#pragma once

#include <sys/types.h>

#include <map>
#include <string>
#include <vector>

#include "platform/Result.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

namespace hearth {

struct LaunchRequest {
  std::string program;
  std::map<std::string, std::string> environment;  // all of it but LISTEN_*
  struct Descriptor {
    std::string name;  // in LISTEN_FDNAMES
    int descriptor;
  };
  std::vector<Descriptor> descriptors;
};

struct LaunchedProcess {
  pid_t pid = 0;
  platform::linux_::UniqueDescriptor process;  // a pidfd
};

// Returns once the program runs, or with the reason why it does not. The process is a group of its own, with
// no signal blocked, and is told by SIGTERM when this process has ended. It is the caller's to reap.
platform::Result<LaunchedProcess> launch(const LaunchRequest& request);

}  // namespace hearth
