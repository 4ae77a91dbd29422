// Notifications within the process, delivered on the poster's thread.
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Value.hpp"

namespace platform {

struct Notification {
  std::string name;
  const void* sender = nullptr;
  std::optional<Dictionary> userInfo;
};

// Any thread. Holds observers weakly, locks one for its call, and calls outside its own lock.
class NotificationCentre {
 public:
  void post(std::string_view name, const void* sender, std::optional<Dictionary> userInfo);

  // Calls `operation` for each notification `name` from `sender`, or from anyone if that is null.
  template <class T>
  void addObserver(const std::shared_ptr<T>& observer, void (T::*operation)(const Notification&),
                   std::string_view name, const void* sender) {
    add({observer, std::string(name), sender, [operation](void* object, const Notification& notification) {
           (static_cast<T*>(object)->*operation)(notification);
         }});
  }
  // From every registration. Compares addresses, so that an observer can remove itself in its own destructor.
  void removeObserver(const void* observer);

 private:
  struct Registration {
    std::weak_ptr<void> observer;
    std::string name;
    const void* sender;
    std::function<void(void*, const Notification&)> call;
    const void* address = nullptr;
    std::uint64_t identifier = 0;
  };
  void add(Registration registration);
  bool isRegistered(std::uint64_t identifier);

  std::mutex mutex;
  std::vector<Registration> registrations;
  std::uint64_t lastIdentifier = 0;
};

}  // namespace platform
