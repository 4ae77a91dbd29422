// Passes the service manager's events about named notifications on to the registered helpers.
#pragma once

#include <memory>
#include <vector>

#include "pairwelld/TarnNotificationHelper.hpp"
#include "platform/Value.hpp"

namespace pairwell {

// One per process. Main thread only: the stream is handled on the main queue, and the platform's centre calls
// the helpers there, too.
class TarnNotificationManager : public std::enable_shared_from_this<TarnNotificationManager> {
 public:
  static std::shared_ptr<TarnNotificationManager> shared();
  TarnNotificationManager() = default;
  virtual ~TarnNotificationManager() = default;

  // No check for duplicates: a helper registered twice is called twice.
  virtual void registerHelper(std::shared_ptr<TarnNotificationHelper> helper);
  // Removes every entry of that object. By reference, since a helper unregisters itself when it is destroyed.
  virtual void unregisterHelper(const TarnNotificationHelper& helper);
  // Once. The handler keeps this manager alive.
  virtual void setUp();

 private:
  void handle(const platform::Dictionary& event);

  std::vector<std::shared_ptr<TarnNotificationHelper>> helpers;
};

}  // namespace pairwell
