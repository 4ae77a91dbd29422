// Audio-accessory limited logging: a switch that turns itself off at an absolute end time.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "pairwelld/notifications/Subscription.hpp"
#include "pairwelld/notifications/SystemNotificationManager.hpp"
#include "pairwelld/settings/KeyValueStoreManager.hpp"
#include "platform/ThreadAnnotations.hpp"
#include "platform/Value.hpp"
#include "platform/WorkQueue.hpp"

namespace pairwell {

// One per process. The state lives on serialQueue; flag and end time live in the cloud store, so that every
// device of the account ends the period at the same moment, and a restart resumes it.
//
// An end time for which there can be no alarm (not finite, or out of its range) counts as none wherever it is
// read. It can come from the store or from a huge override; in the second case it is stored as computed, the
// alarm is rejected, and the period lasts until somebody ends it. A restart then finds a period without an
// end time, and computes it anew from the override of that moment.
class DebugManager : public KeyValueStoreManagerSubscribing,
                     public SystemNotificationManagerSubscribing,
                     public std::enable_shared_from_this<DebugManager> {
 public:
  const std::shared_ptr<KeyValueStoreManager> kvs;
  // Main thread. Each handle holds this manager, which is not destroyed before they are dropped.
  std::optional<Subscription<KeyValueStoreManagerSubscribing>> kvsSubscription;
  std::optional<Subscription<SystemNotificationManagerSubscribing>> systemNotificationSubscription;
  const std::shared_ptr<platform::SerialQueue> serialQueue;
  bool _audioAccessoryLimitedLoggingEnabled PW_GUARDED_BY(*serialQueue) = false;

  // Whether logging is on, with expiry applied: the first read after the end time answers false and starts
  // the stop. Any thread but serialQueue's, onto which it hops; the end time is read on the caller's thread.
  virtual bool audioAccessoryLimitedLoggingEnabled();
  // Any thread. Returns at once; a read made straight afterwards may still see the old state.
  virtual void setAudioAccessoryLimitedLoggingEnabled(bool enabled);

  static std::shared_ptr<DebugManager> create(std::shared_ptr<KeyValueStoreManager> kvs);
  ~DebugManager() override;

  // Main thread, once. The first refresh may complete after it has returned.
  virtual void activate();

  void keyValueChanged(KeyValueSource source, const std::vector<std::string>& keys) override;
  void didReceiveNotification(SystemNotificationSource source, std::string_view name) override;

 protected:
  explicit DebugManager(std::shared_ptr<KeyValueStoreManager> kvs_);

 private:
  // The only writer of the state.
  void applyLimitedLogging(bool enabled) PW_REQUIRES(*serialQueue);
  // `storedEndTime` in seconds since 1970; not greater than 0: a new period.
  void startLimitedLogging(double storedEndTime) PW_REQUIRES(*serialQueue);
  void stopLimitedLogging() PW_REQUIRES(*serialQueue);
  void enqueueRefresh();
  void refreshFromCloud() PW_REQUIRES(*serialQueue);
  void applyRefresh(bool enabled) PW_REQUIRES(*serialQueue);
  double endTime();
  platform::Time expirationDate();
};

}  // namespace pairwell
