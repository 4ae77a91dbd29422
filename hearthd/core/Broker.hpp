// Who hears of a named notification: connections that watch it, and jobs whose files list it.
#pragma once

#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <vector>

namespace hearth {

class Broker {
 public:
  using Watcher = std::uint64_t;

  // Watching a name twice is watching it once. False when the watcher has as many names as it may, or the
  // name is longer than names are.
  [[nodiscard]] bool watch(Watcher watcher, const std::string& name);
  void unwatch(Watcher watcher, const std::string& name);
  // It has gone.
  void remove(Watcher watcher);
  std::vector<Watcher> watchers(const std::string& name) const;

  // Events of the matching stream are for the names that a job's file lists, and for no others.
  void listMatching(const std::string& job, const std::vector<std::string>& names);
  std::vector<std::string> matchingJobs(const std::string& name) const;

 private:
  std::map<std::string, std::set<Watcher>> byName;
  std::map<Watcher, std::set<std::string>> byWatcher;
  std::map<std::string, std::set<std::string>> jobsByName;
};

}  // namespace hearth
