// Notices changes in the three sources, whoever made them.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "pairwelld/settings/KeyValueSource.hpp"
#include "platform/NotificationCentre.hpp"
#include "platform/Stores.hpp"

namespace pairwell {

// No queue of its own: `notify` is called on the thread that delivers each event, also on several at a time.
class KeyValueStoreCustomObserver : public platform::KeyObserver,
                                    public std::enable_shared_from_this<KeyValueStoreCustomObserver> {
 public:
  using Notify = std::function<void(KeyValueSource source, const std::vector<std::string>& keys)>;

  // The user preferences as they were at construction.
  const std::shared_ptr<platform::UserPreferences> defaults;
  const std::vector<std::string> monitoredUserDefaultKeys;
  const Notify notify;
  // -1 until registered. Not reset by stop().
  std::int32_t rootPrefsChangeToken = -1;

  static std::shared_ptr<KeyValueStoreCustomObserver> create(
      std::vector<std::string> monitoredUserDefaultKeys, Notify notify);
  ~KeyValueStoreCustomObserver() override;

  // Once.
  virtual void start();
  // Harmless a second time and before start().
  virtual void stop();
  virtual void observeCloudStore();
  virtual void observeRootPreferences();
  // Whichever store reports it, the change counts as the user's.
  void observeValue(const std::optional<std::string>& keyPath, const void* object) override;
  // A change of the cloud store from outside the process.
  virtual void handleUbiquitousKeyValueStoreChange(const platform::Notification& notification);
  // The daemon's own cloud write, inside it.
  virtual void handleUbiquitousKeyValueStoreChangeLocally(const platform::Notification& notification);

 protected:
  KeyValueStoreCustomObserver(std::vector<std::string> monitoredUserDefaultKeys_, Notify notify_);
};

}  // namespace pairwell
