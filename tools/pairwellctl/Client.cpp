#include "tools/pairwellctl/Client.hpp"

#include <utility>

#include "pairwelld/settings/Defaults.hpp"
#include "platform/NotificationCentre.hpp"
#include "platform/linux/BusServiceListener.hpp"
#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/LinuxEnvironment.hpp"
#include "platform/linux/LinuxFileSystem.hpp"
#include "platform/linux/ReplicaFileCloudStore.hpp"

namespace pairwellctl {
namespace {

using platform::linux_::BusClient;
using platform::linux_::BusError;

constexpr const char* serviceName = "com.kestrel.pairwell.conduit";
constexpr const char* cloudIdentifier = "com.kestrel.bluetooth.cloud.settings";
constexpr const char* settingsChanged = "com.kestrel.pairwell.settingsChanged";

// An error that the service itself answered goes into `what`.
platform::Result<platform::List> call(BusClient& client, const platform::linux_::BusInterface& interface,
                                      const std::string& operation, const platform::List& arguments,
                                      std::chrono::milliseconds timeout, std::string& what) {
  auto reply = client.call(interface, operation, arguments, timeout);
  if (!reply) return reply.error();
  if (auto* results = std::get_if<platform::List>(&*reply)) return std::move(*results);
  const auto& error = std::get<BusError>(*reply);
  what += ": " + error.name + ": " + error.message;
  return std::make_error_code(std::errc::protocol_error);
}

}  // namespace

Client::Client(platform::linux_::Paths paths_, std::chrono::milliseconds timeout_)
    : paths(std::move(paths_)), timeout(timeout_) {}

platform::Result<platform::List> Client::call(const std::string& operation, const platform::List& arguments,
                                              std::string& what) const {
  what = paths.serviceSocket(serviceName);
  auto client = BusClient::connect(what, timeout);
  if (!client) return client.error();
  return pairwellctl::call(**client, platform::linux_::clientInterface(serviceName), operation, arguments,
                           timeout, what);
}

double Client::end() const {
  platform::linux_::LinuxFileSystem files(nullptr);
  platform::linux_::LinuxClock clock;
  platform::NotificationCentre centre;
  const auto cloud = platform::linux_::ReplicaFileCloudStore::create(files, nullptr, centre, clock,
                                                                     paths.cloudSettings(cloudIdentifier));
  const double end =
      cloud->doubleForKey(platform::rawValue(pairwell::Defaults::velaLogCloudCollectionEnabledExpiration));
  return end > clock.now().count() ? end : 0;
}

std::error_code Client::watch(const std::function<std::error_code()>& changed, std::string& what) const {
  what = paths.hearthdSocket();
  auto client = BusClient::connect(what, timeout);
  if (!client) return client.error();
  const auto watched = pairwellctl::call(**client, platform::linux_::hearthInterface(), "Watch",
                                         {settingsChanged}, timeout, what);
  if (!watched) return watched.error();
  for (;;) {
    const auto signal = (*client)->nextSignal(std::nullopt);
    if (!signal) return signal.error();
    if (const auto failed = changed()) return failed;
  }
}

}  // namespace pairwellctl
