// Callbacks for system-wide named notifications, by name.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>

namespace pairwell {

// Observes its names with the platform's centre, and is reached through TarnNotificationManager by way of the
// service manager's stream as well. Main thread: created, called and destroyed there. The manager's list
// keeps it alive until it is unregistered.
class TarnNotificationHelper {
 public:
  using Callback = std::function<void()>;

  // The names, compared exactly, and what runs for each.
  std::map<std::string, Callback> notificationHandlers;

  // Stops the process when the platform has no centre. The platform's names are texts, so one construction
  // serves both kinds of key.
  static std::shared_ptr<TarnNotificationHelper> create(std::map<std::string, Callback> notificationHandlers);
  TarnNotificationHelper(const TarnNotificationHelper&) = delete;
  TarnNotificationHelper& operator=(const TarnNotificationHelper&) = delete;
  virtual ~TarnNotificationHelper();

  // Runs the callback of that name, if there is one, on the caller's thread. The callback may unregister its
  // helper; the caller holds it meanwhile.
  virtual void on(const std::string& notificationName);

 protected:
  explicit TarnNotificationHelper(std::map<std::string, Callback> notificationHandlers_)
      : notificationHandlers(std::move(notificationHandlers_)) {}

 private:
  static void centreCallback(const std::shared_ptr<void>& observer, const std::optional<std::string>& name);
};

}  // namespace pairwell
