// The etc/ of a root: laying it out, and what it grants.
#pragma once

#include <string>

#include "platform/linux/FileSystem.hpp"
#include "platform/linux/Paths.hpp"
#include "tools/Output.hpp"
#include "tools/hearthctl/Cloud.hpp"

namespace tools {

struct Device {
  std::string name;  // empty: the machine's
  std::string build;
  bool isInternal = false;
  AccountOptions account = {};
};

// Device, jobs and entitlements, for the programs that lie beside this one. A file
// that is there stays as it is.
Exit init(Output& output, const platform::linux_::Paths& paths, platform::linux_::FileSystem& files,
          const Device& device);

// Every entitlement file, and if it does not count, why not. Seen as this process's user: the daemon's may
// trust others.
Exit listGrants(Output& output, const platform::linux_::Paths& paths, platform::linux_::FileSystem& files);

}  // namespace tools
