#include "bench/Device.hpp"

#include <signal.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <utility>

#include "platform/linux/BusServiceListener.hpp"
#include "platform/linux/HearthInterface.hpp"

namespace bench {

namespace fs = std::filesystem;
using platform::linux_::BusClient;

Device::Device(const std::string& programs, const std::string& options) {
  _paths = platform::linux_::Paths::under(root.path);
  fs::create_directory(root.path + "/bin");
  for (const char* program : {"hearthd", "pairwelld", "cloudsyncd", "hearthctl", "pairwellctl"}) {
    fs::copy_file(programs + "/" + program, root.path + "/bin/" + program);
  }
  const std::string init =
      root.path + "/bin/hearthctl --root " + root.path + " init " + options + " >/dev/null";
  if (std::system(init.c_str()) != 0) throw std::runtime_error("hearthctl init failed");
  std::ofstream(_paths.entitlements() + "/bench.json")
      << "{\"executable\": \"" << thisProgram() << "\", \"entitlements\": {\""
      << pairwell::names::systemEntitlement << "\": true}}\n";
}

Device::~Device() { stop(); }

void Device::start() {
  process.emplace([&] { become({root.path + "/bin/hearthd", "--root", root.path}, root.path + "/log"); });
}

void Device::stop() {
  if (process) process->end(SIGTERM);
}

pid_t Device::job(const std::string& program) const {
  const std::string id = std::to_string(hearthd());
  pid_t child = -1;
  await(program + " does not run", [&] {
    std::ifstream children("/proc/" + id + "/task/" + id + "/children");
    while (children >> child) {
      std::string name;
      std::getline(std::ifstream("/proc/" + std::to_string(child) + "/comm"), name);
      if (name == program) return true;
    }
    return false;
  });
  return child;
}

Service Device::service() const {
  return {_paths.serviceSocket(pairwell::names::service), "", clientInterface().path, clientInterface().name};
}

Service Device::hearthdService() const {
  const auto& interface = platform::linux_::hearthInterface();
  return {_paths.hearthdSocket(), "", interface.path, interface.name};
}

std::unique_ptr<BusClient> Device::connect(const std::string& socket) {
  std::unique_ptr<BusClient> connected;
  await(socket + ": nobody answers", [&] {
    auto client = BusClient::connect(socket, std::chrono::seconds(5));
    if (client) connected = std::move(*client);
    return connected != nullptr;
  });
  return connected;
}

platform::List call(BusClient& client, const platform::linux_::BusInterface& interface,
                    const std::string& operation, const platform::List& arguments) {
  auto reply = client.call(interface, operation, arguments, std::chrono::seconds(5));
  auto* results = reply ? std::get_if<platform::List>(&*reply) : nullptr;
  if (!results) throw std::runtime_error(operation + " failed");
  return std::move(*results);
}

const platform::linux_::BusInterface& clientInterface() {
  static const auto interface = platform::linux_::clientInterface(pairwell::names::service);
  return interface;
}

void watch(BusClient& client, std::string_view notification) {
  call(client, platform::linux_::hearthInterface(), "Watch", {std::string(notification)});
}

void awaitSignal(BusClient& client) {
  const auto signal = client.nextSignal(std::chrono::seconds(5));
  if (!signal || !*signal) throw std::runtime_error("a switch was not announced");
}

}  // namespace bench
