#include "hearthd/core/PendingEvents.hpp"

namespace hearth {

bool PendingEvents::add(const std::string& job, const std::string& stream, const std::string& name) {
  if (hasHandler(job, stream)) return true;
  waiting[{job, stream}].insert(name);
  return false;
}

std::vector<std::string> PendingEvents::handlerInstalled(const std::string& job, const std::string& stream) {
  handlers.emplace(job, stream);
  const auto found = waiting.find({job, stream});
  if (found == waiting.end()) return {};
  std::vector<std::string> names(found->second.begin(), found->second.end());
  waiting.erase(found);
  return names;
}

void PendingEvents::jobEnded(const std::string& job) {
  std::erase_if(handlers, [&](const Place& place) { return place.first == job; });
}

bool PendingEvents::hasHandler(const std::string& job, const std::string& stream) const {
  return handlers.count({job, stream}) > 0;
}

}  // namespace hearth
