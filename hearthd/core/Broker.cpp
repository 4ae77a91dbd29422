#include "hearthd/core/Broker.hpp"

#include "platform/ClientLimits.hpp"

namespace hearth {

bool Broker::watch(Watcher watcher, const std::string& name) {
  if (name.size() > platform::limits::nameBytes) return false;
  auto& names = byWatcher[watcher];
  if (names.size() >= platform::limits::watchedNames && names.count(name) == 0) return false;
  names.insert(name);
  byName[name].insert(watcher);
  return true;
}

void Broker::unwatch(Watcher watcher, const std::string& name) {
  if (const auto names = byWatcher.find(watcher); names != byWatcher.end()) {
    names->second.erase(name);
    if (names->second.empty()) byWatcher.erase(names);
  }
  if (const auto watching = byName.find(name); watching != byName.end()) {
    watching->second.erase(watcher);
    if (watching->second.empty()) byName.erase(watching);
  }
}

void Broker::remove(Watcher watcher) {
  const auto found = byWatcher.find(watcher);
  if (found == byWatcher.end()) return;
  const std::set<std::string> names = std::move(found->second);
  byWatcher.erase(found);
  for (const std::string& name : names) unwatch(watcher, name);
}

std::vector<Broker::Watcher> Broker::watchers(const std::string& name) const {
  const auto found = byName.find(name);
  if (found == byName.end()) return {};
  return {found->second.begin(), found->second.end()};
}

void Broker::listMatching(const std::string& job, const std::vector<std::string>& names) {
  for (const std::string& name : names) jobsByName[name].insert(job);
}

std::vector<std::string> Broker::matchingJobs(const std::string& name) const {
  const auto found = jobsByName.find(name);
  if (found == jobsByName.end()) return {};
  return {found->second.begin(), found->second.end()};
}

}  // namespace hearth
