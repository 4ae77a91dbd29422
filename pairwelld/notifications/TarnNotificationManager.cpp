#include "pairwelld/notifications/TarnNotificationManager.hpp"

#include <algorithm>
#include <iterator>
#include <utility>

#include "pairwelld/Log.hpp"
#include "platform/Platform.hpp"

namespace pairwell {
namespace {

const platform::SlotKey sharedKey;

}  // namespace

std::shared_ptr<TarnNotificationManager> TarnNotificationManager::shared() {
  return platform::current().slot<std::shared_ptr<TarnNotificationManager>>(
      sharedKey, [] { return std::make_shared<TarnNotificationManager>(); });
}

void TarnNotificationManager::registerHelper(std::shared_ptr<TarnNotificationHelper> helper) {
  helpers.push_back(std::move(helper));
}

void TarnNotificationManager::unregisterHelper(const TarnNotificationHelper& helper) {
  std::vector<std::shared_ptr<TarnNotificationHelper>> rest;
  std::copy_if(helpers.begin(), helpers.end(), std::back_inserter(rest),
               [&](const auto& entry) { return entry.get() != &helper; });
  // The old list goes last: a helper that dies with it comes back here, and must find the new one.
  helpers.swap(rest);
}

void TarnNotificationManager::setUp() {
  platform::current().eventStreams().setHandler(
      platform::EventStreams::matching, platform::current().runLoop().mainQueue(),
      // Strong: the stream is handled for as long as the process lives.
      [self = shared_from_this()](const platform::Dictionary& event) { self->handle(event); });
}

void TarnNotificationManager::handle(const platform::Dictionary& event) {
  const auto entry = event.find(platform::EventStreams::nameKey);
  const auto name = entry == event.end() ? std::nullopt : platform::toText(entry->second);
  if (!name) return;
  Log::daemon().default_("On conduit event stream, com.kestrel.tidingsd.matching, notification %s", *name);
  const auto current = helpers;  // a callback may change the list
  for (const auto& helper : current) helper->on(*name);
}

}  // namespace pairwell
