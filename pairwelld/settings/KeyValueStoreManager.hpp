// The daemon's single access to its settings: reads, writes, and change notices to subscribers.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "pairwelld/notifications/Subscribable.hpp"
#include "pairwelld/notifications/Subscription.hpp"
#include "pairwelld/settings/Defaults.hpp"
#include "pairwelld/settings/KeyValueSource.hpp"
#include "pairwelld/settings/KeyValueStoreCustomObserver.hpp"
#include "platform/ThreadAnnotations.hpp"
#include "platform/Value.hpp"
#include "platform/WorkQueue.hpp"

namespace pairwell {

class KeyValueStoreManagerSubscribing {
 public:
  virtual ~KeyValueStoreManagerSubscribing() = default;
  // On the manager's serialQueue, with one raw key name or none. May call the manager.
  virtual void keyValueChanged(KeyValueSource source, const std::vector<std::string>& keys) = 0;
};

// One per process. Caches no values: reads and writes go to the stores on the caller's thread, at the same
// time as others. serialQueue waits for subscriptionQueue, never the reverse.
class KeyValueStoreManager : public std::enable_shared_from_this<KeyValueStoreManager> {
 public:
  using Defaults = pairwell::Defaults;
  using Subscriber = KeyValueStoreManagerSubscribing;

  // Every call of a subscriber runs here.
  const std::shared_ptr<platform::SerialQueue> serialQueue;
  const std::shared_ptr<platform::SerialQueue> subscriptionQueue;
  std::vector<Subscription<Subscriber>> subscriptions PW_GUARDED_BY(*subscriptionQueue);

  // Made on first access, and kept. Main thread.
  virtual std::shared_ptr<KeyValueStoreCustomObserver> keyValueStoreObserver();
  virtual void setKeyValueStoreObserver(std::shared_ptr<KeyValueStoreCustomObserver> observer);

  static std::shared_ptr<KeyValueStoreManager> create();
  virtual ~KeyValueStoreManager();

  // Once: a second call would report every change twice.
  virtual void activate();
  // False and 0.0 for what is absent, unreadable or of another type.
  virtual bool getBool(KeyValueSource source, Defaults key);
  virtual double getDouble(KeyValueSource source, Defaults key);
  // No value removes the key. Failures are logged and not retried.
  virtual void setValue(KeyValueSource source, const std::optional<platform::Value>& value, Defaults key);
  virtual void setValue(const std::vector<KeyValueSource>& sources,
                        const std::optional<platform::Value>& value, Defaults key);
  // Any thread; waits for subscriptionQueue.
  virtual Subscription<Subscriber> subscribe(const std::shared_ptr<Subscriber>& subscriber);
  virtual void unsubscribe(const Subscription<Subscriber>& subscription);
  // Any thread: schedules and posts, and calls no subscriber itself.
  virtual void handleStoreChange(KeyValueSource source, const std::vector<std::string>& keys);
  virtual void notifySubscribers(KeyValueSource source, const std::optional<std::string>& key);
  virtual void deliverChange(KeyValueSource source, const std::optional<std::string>& key)
      PW_REQUIRES(*serialQueue);

 protected:
  KeyValueStoreManager();

 private:
  std::optional<platform::Value> readRoot(std::string_view format, Defaults key);
  void setCloudValue(const std::optional<platform::Value>& value, std::string_view key);
  void setRootValue(const std::optional<platform::Value>& value, std::string_view key);

  std::shared_ptr<KeyValueStoreCustomObserver> keyValueStoreObserver_;
};

static_assert(Subscribable<KeyValueStoreManager>);

}  // namespace pairwell
