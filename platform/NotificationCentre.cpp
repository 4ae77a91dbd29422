#include "platform/NotificationCentre.hpp"

#include <algorithm>
#include <utility>

namespace platform {

void NotificationCentre::post(std::string_view name, const void* sender, std::optional<Dictionary> userInfo) {
  std::vector<Registration> matching;
  {
    std::lock_guard lock(mutex);
    for (const Registration& registration : registrations) {
      if (registration.name != name) continue;
      if (registration.sender == nullptr || registration.sender == sender) matching.push_back(registration);
    }
  }
  const Notification notification{std::string(name), sender, std::move(userInfo)};
  for (const Registration& registration : matching) {
    const auto observer = registration.observer.lock();
    // It may live and have been removed meanwhile, by an observer called before it.
    if (observer && isRegistered(registration.identifier)) registration.call(observer.get(), notification);
  }
}

void NotificationCentre::add(Registration registration) {
  registration.address = registration.observer.lock().get();
  std::lock_guard lock(mutex);
  registration.identifier = ++lastIdentifier;
  registrations.push_back(std::move(registration));
}

bool NotificationCentre::isRegistered(std::uint64_t identifier) {
  std::lock_guard lock(mutex);
  return std::any_of(registrations.begin(), registrations.end(),
                     [&](const Registration& registration) { return registration.identifier == identifier; });
}

void NotificationCentre::removeObserver(const void* observer) {
  std::lock_guard lock(mutex);
  std::erase_if(registrations,
                [&](const Registration& registration) { return registration.address == observer; });
}

}  // namespace platform
