#include "tools/pairwellctl/Client.hpp"

#include <utility>

#include "pairwelld/settings/Defaults.hpp"
#include "platform/NotificationCentre.hpp"
#include "platform/linux/BusClient.hpp"
#include "platform/linux/BusServiceListener.hpp"
#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/LinuxEnvironment.hpp"
#include "platform/linux/LinuxFileSystem.hpp"
#include "platform/linux/ReplicaFileCloudStore.hpp"
#include "tools/End.hpp"

namespace tools {
namespace {

using platform::linux_::BusClient;

constexpr const char* serviceName = "com.kestrel.pairwell.conduit";
constexpr const char* cloudIdentifier = "com.kestrel.bluetooth.cloud.settings";
constexpr const char* settingsChanged = "com.kestrel.pairwell.settingsChanged";

}  // namespace

Client::Client(platform::linux_::Paths paths_, std::chrono::milliseconds timeout_)
    : paths(std::move(paths_)), timeout(timeout_) {}

platform::Result<platform::List> Client::call(const std::string& operation, const platform::List& arguments) {
  asked = paths.serviceSocket(serviceName);
  answer.clear();
  auto client = BusClient::connect(asked, timeout);
  if (!client) return client.error();
  const auto interface = platform::linux_::clientInterface(serviceName);
  return resultsOf((*client)->call(interface, operation, arguments, timeout), answer);
}

double Client::end() const {
  platform::linux_::LinuxFileSystem files(nullptr);
  platform::linux_::LinuxClock clock;
  platform::NotificationCentre centre;
  const auto cloud = platform::linux_::ReplicaFileCloudStore::create(files, nullptr, centre, clock,
                                                                     paths.cloudSettings(cloudIdentifier));
  const double end =
      cloud->doubleForKey(platform::rawValue(pairwell::Defaults::velaLogCloudCollectionEnabledExpiration));
  return isEnd(end) && end > clock.now().count() ? end : 0;
}

std::error_code Client::watch(const std::function<std::error_code()>& changed) {
  asked = paths.hearthdSocket();
  auto hearthd = BusClient::connect(asked, timeout);
  if (!hearthd) return hearthd.error();
  const auto& interface = platform::linux_::hearthInterface();
  const auto watched = resultsOf((*hearthd)->call(interface, "Watch", {settingsChanged}, timeout), answer);
  if (!watched) return watched.error();
  for (;;) {
    const auto signal = (*hearthd)->nextSignal(std::nullopt);
    if (!signal) {
      asked = paths.hearthdSocket();
      return signal.error();
    }
    if (const auto failed = changed()) return failed;
  }
}

}  // namespace tools
