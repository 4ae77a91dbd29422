#include "bench/Device.hpp"

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <thread>

namespace bench {

namespace fs = std::filesystem;
using platform::linux_::BusClient;

Device::Device(const std::string& programs, const std::string& benchmark) {
  char name[] = "/tmp/pairwell-bench-XXXXXX";
  if (!::mkdtemp(name)) throw std::runtime_error("no temporary folder");
  root = name;
  _paths = platform::linux_::Paths::under(root);
  fs::create_directory(root + "/bin");
  for (const char* program : {"hearthd", "pairwelld", "hearthctl", "pairwellctl"}) {
    fs::copy_file(programs + "/" + program, root + "/bin/" + program);
  }
  const std::string init = root + "/bin/hearthctl --root " + root + " init >/dev/null";
  if (std::system(init.c_str()) != 0) throw std::runtime_error("hearthctl init failed");
  std::ofstream(_paths.entitlements() + "/bench.json")
      << "{\"executable\": \"" << benchmark << "\", \"entitlements\": {\""
      << pairwell::names::systemEntitlement << "\": true}}\n";
}

Device::~Device() {
  stop();
  fs::remove_all(root);
}

void Device::start() {
  pid = ::fork();
  if (pid == 0) {
    if (!std::freopen((root + "/log").c_str(), "a", stderr)) ::_exit(126);
    const std::string program = root + "/bin/hearthd";
    ::execl(program.c_str(), "hearthd", "--root", root.c_str(), nullptr);
    ::_exit(127);
  }
}

void Device::stop() {
  if (pid <= 0) return;
  ::kill(pid, SIGTERM);
  ::waitpid(pid, nullptr, 0);
  pid = -1;
}

pid_t Device::pairwelld() const {
  std::ifstream children("/proc/" + std::to_string(pid) + "/task/" + std::to_string(pid) + "/children");
  pid_t child = -1;
  children >> child;
  return child;
}

std::unique_ptr<BusClient> Device::client() const {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (std::chrono::steady_clock::now() < deadline) {
    auto client = BusClient::connect(clientSocket(), std::chrono::seconds(5));
    if (client) return std::move(*client);
    std::this_thread::sleep_for(std::chrono::microseconds(200));
  }
  throw std::runtime_error("the client service does not answer");
}

}  // namespace bench
