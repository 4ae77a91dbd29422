#include "pairwelld/TarnNotificationHelper.hpp"

#include <utility>

#include "pairwelld/Log.hpp"
#include "pairwelld/notifications/TarnNotificationManager.hpp"
#include "platform/Platform.hpp"

namespace pairwell {

std::shared_ptr<TarnNotificationHelper> TarnNotificationHelper::create(
    std::map<std::string, Callback> notificationHandlers) {
  auto* centre = platform::current().namedNotificationCentre();
  if (!centre) platform::stop("tarnCenter not available");
  std::shared_ptr<TarnNotificationHelper> helper(new TarnNotificationHelper(std::move(notificationHandlers)));
  TarnNotificationManager::shared()->registerHelper(helper);
  Log::daemon().default_("Setup tarn callback handlers");
  for (const auto& [name, callback] : helper->notificationHandlers) {
    Log::daemon().default_("Setting up tarn callback handler for %s", name);
    centre->addObserver(helper, &TarnNotificationHelper::centreCallback, name);
  }
  return helper;
}

TarnNotificationHelper::~TarnNotificationHelper() {
  TarnNotificationManager::shared()->unregisterHelper(*this);
  auto* centre = platform::current().namedNotificationCentre();
  if (!centre) return;
  for (const auto& [name, callback] : notificationHandlers) {
    Log::daemon().default_("Remove tarn callback handler for %s", name);
    centre->removeObserver(this, name);
  }
}

void TarnNotificationHelper::on(const std::string& notificationName) {
  const auto found = notificationHandlers.find(notificationName);
  if (found == notificationHandlers.end()) return;
  Log::daemon().default_("Invoking callback, notification, %s", notificationName);
  const Callback callback = found->second;  // it may replace the map that it came from
  callback();
}

void TarnNotificationHelper::centreCallback(const std::shared_ptr<void>& observer,
                                            const std::optional<std::string>& name) {
  if (!observer) {
    Log::daemon().error("Observer for tarn callback handler not found");
    return;
  }
  if (!name) {
    Log::daemon().error("loomNotificationName for tarn callback handler not found");
    return;
  }
  Log::daemon().default_("Got tarn notification, %s", *name);
  static_cast<TarnNotificationHelper*>(observer.get())->on(*name);
}

}  // namespace pairwell
