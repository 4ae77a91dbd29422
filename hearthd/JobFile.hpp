// The files that describe jobs.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "platform/linux/FileSystem.hpp"

namespace hearth {

// One file of etc/jobs, for example
//
//   {"name": "com.kestrel.pairwelld", "program": "bin/pairwelld",
//    "services": ["com.kestrel.pairwell.conduit"],
//    "streams": ["com.kestrel.alarm", "com.kestrel.tidingsd.matching"], "matching": ["com.kestrel.example"],
//    "environment": {"LANG": "C.UTF-8"}, "restart": true}
//
// Only name and program are needed.
struct JobDescription {
  std::string name;
  std::string program;  // absolute; in the file it may be relative to the root
  std::map<std::string, std::string> environment;
  std::vector<std::string> services;  // the first is the job's CONDUIT_SERVICE_NAME
  std::vector<std::string> streams;   // whose events the job consumes, and may set
  std::vector<std::string> matching;  // notifications that come as events of com.kestrel.tidingsd.matching
  bool restart = true;                // after it has ended by itself
};

// All that are sound, by file name. The others are named in the log, with the place of the fault, and left
// out; so is one that takes the name, or a service, of an earlier one. A refusal that may pass, of a disk, or
// for want of descriptors or memory, is an error, and logged, too: whoever starts hearthd tries again.
platform::Result<std::vector<JobDescription>> readJobs(platform::linux_::FileSystem& files,
                                                       const std::string& folder, const std::string& root);

}  // namespace hearth
