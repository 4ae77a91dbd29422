// The files that describe jobs.
#pragma once

#include <map>
#include <string>
#include <system_error>
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

// Whether the system may grant another time what it refused: for want of space, descriptors or memory.
// hearthd then ends, and whoever starts it tries again; a job that is left out, or the alarms, would be so
// for long. All else, a bad sector, too, is wrong with the one file, and no reason to keep the other jobs
// down.
bool mayPass(std::error_code error);

// All that are sound, by file name. The others are named in the log, with the place of the fault, and left
// out; so is one that takes the name, or a service, of an earlier one. A refusal that may pass is an error,
// and logged, too.
platform::Result<std::vector<JobDescription>> readJobs(platform::linux_::FileSystem& files,
                                                       const std::string& folder, const std::string& root);

}  // namespace hearth
