// Events that are not alarms (matching notifications, events delivered by hand), until their job takes them.
#pragma once

#include <map>
#include <set>
#include <string>
#include <utility>
#include <vector>

namespace hearth {

// In memory only: these events tell of something that happened, and mean nothing after a restart of hearthd.
class PendingEvents {
 public:
  // True: the job has a handler, deliver at once. False: kept until it has one; those of a name merge.
  [[nodiscard]] bool add(const std::string& job, const std::string& stream, const std::string& name);
  // The names that waited.
  std::vector<std::string> handlerInstalled(const std::string& job, const std::string& stream);
  void jobEnded(const std::string& job);
  bool hasHandler(const std::string& job, const std::string& stream) const;

 private:
  using Place = std::pair<std::string, std::string>;  // job, stream
  std::set<Place> handlers;
  std::map<Place, std::set<std::string>> waiting;
};

}  // namespace hearth
