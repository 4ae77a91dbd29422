#include "tools/pairwellctl/Client.hpp"

#include <utility>

#include "pairwelld/Names.hpp"
#include "platform/linux/BusClient.hpp"
#include "platform/linux/BusServiceListener.hpp"
#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/LinuxEnvironment.hpp"
#include "platform/linux/LinuxFileSystem.hpp"
#include "tools/StoredSettings.hpp"

namespace tools {

using platform::linux_::BusClient;

Client::Client(platform::linux_::Paths paths_, std::chrono::milliseconds timeout_)
    : paths(std::move(paths_)), timeout(timeout_) {}

platform::Result<platform::List> Client::call(const std::string& operation, const platform::List& arguments) {
  asked = paths.serviceSocket(pairwell::names::service);
  answer.clear();
  auto client = BusClient::connect(asked, timeout);
  if (!client) return client.error();
  const auto interface = platform::linux_::clientInterface(pairwell::names::service);
  return resultsOf((*client)->call(interface, operation, arguments, timeout), answer);
}

double Client::end() const {
  platform::linux_::LinuxFileSystem files(nullptr);
  std::string problem;
  const auto values = storedValues(files, paths, pairwell::KeyValueSource::cloud, problem);
  const auto end = values ? endIn(*values) : std::nullopt;
  return end && *end > platform::linux_::LinuxClock().now().count() ? *end : 0;
}

std::error_code Client::watch(const std::function<std::error_code()>& changed) {
  asked = paths.hearthdSocket();
  auto hearthd = BusClient::connect(asked, timeout);
  if (!hearthd) return hearthd.error();
  const auto& interface = platform::linux_::hearthInterface();
  const auto watched = resultsOf(
      (*hearthd)->call(interface, "Watch", {std::string(pairwell::names::settingsChanged)}, timeout), answer);
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
