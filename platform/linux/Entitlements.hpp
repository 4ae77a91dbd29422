// What the machine's administrator grants to which programs.
#pragma once

#include <sys/types.h>

#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/Value.hpp"
#include "platform/linux/FileSystem.hpp"
#include "platform/linux/Paths.hpp"
#include "platform/linux/PeerIdentity.hpp"

namespace platform::linux_ {

// One file of etc/entitlements.d, for example
//
//   {"executable": "bin/pairwellctl", "uid": 1000, "entitlements": {"com.kestrel.bluetooth.system": true}}
//
// The executable may be relative to the root; "uid" and "gid" are optional and narrow the grant.
struct EntitlementGrant {
  std::string file;
  std::string executable;
  std::optional<uid_t> user;
  std::optional<gid_t> group;
  Dictionary entitlements;  // values of any type
  std::string problem;      // why the grant does not count; empty if it does
};

// All of them, by file name. A grant counts only if its file, the executable, and the folders above both can
// be written by nobody but root and this process's user; in a sticky folder others cannot touch what these
// two own.
std::vector<EntitlementGrant> readGrants(FileSystem& files, const Paths& paths);

// Any thread.
class Entitlements {
 public:
  // `files` outlives the object.
  Entitlements(FileSystem& files, Paths paths);

  // Read anew at each call: grants take effect with the next connection. Of two grants of one name the later
  // file's counts. Grants that do not count are named in the log, once for each reason.
  Dictionary of(const PeerIdentity& peer);

 private:
  void sayOnce(const EntitlementGrant& grant);

  FileSystem& files;
  const Paths paths;
  std::mutex mutex;
  std::set<std::string> said;  // guarded by `mutex`
};

}  // namespace platform::linux_
