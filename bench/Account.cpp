#include "bench/Account.hpp"

#include <stdlib.h>

#include <chrono>
#include <filesystem>
#include <memory>
#include <stdexcept>
#include <thread>
#include <vector>

#include "bench/Peers.hpp"
#include "bench/Report.hpp"
#include "pairwelld/Names.hpp"
#include "platform/NotificationCentre.hpp"
#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/LinuxEnvironment.hpp"
#include "platform/linux/LinuxFileSystem.hpp"
#include "platform/linux/ReplicaFileCloudStore.hpp"

namespace bench {
namespace {

using namespace std::chrono_literals;
using platform::linux_::BusClient;

constexpr std::size_t switches = 200;
constexpr int changes = 1000;

std::string makeFolder() {
  char name[] = "/tmp/pairwell-bench-XXXXXX";
  if (!::mkdtemp(name)) throw std::runtime_error("no temporary folder");
  return name;
}

std::string options(const std::string& share) { return "--cloud dir:" + share + " --account bench"; }

// The cloud store of a device, as another process of it sees it.
struct Store {
  explicit Store(const Device& device)
      : store(platform::linux_::ReplicaFileCloudStore::create(
            files, nullptr, centre, clock, device.paths().cloudSettings(pairwell::names::cloudStore))) {}
  platform::linux_::LinuxFileSystem files{nullptr};
  platform::NotificationCentre centre;
  platform::linux_::LinuxClock clock;
  const std::shared_ptr<platform::linux_::ReplicaFileCloudStore> store;
};

template <class Condition>
void await(const char* what, Condition condition) {
  const auto deadline = std::chrono::steady_clock::now() + 60s;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) throw std::runtime_error(what);
    std::this_thread::sleep_for(1ms);
  }
}

void control(Device& device, const char* action) {
  call(*device.hearthdClient(), platform::linux_::hearthInterface(), "ControlJob",
       {action, "com.kestrel.cloudsyncd"});
}

// Switches at `from`; returns when the device of the other two has announced it and answers so.
void switchTo(bool state, BusClient& from, BusClient& to, BusClient& announcements) {
  call(from, clientInterface(), "SetKestrelAudioAccessoryLimitedLogging", {state});
  do {
    awaitSignal(announcements);
  } while (call(to, clientInterface(), "KestrelAudioAccessoryLimitedLogging") != platform::List{state});
}

}  // namespace

Account::Account(const std::string& programs, const std::string& benchmark)
    : folder(makeFolder()),
      share(folder + "/share"),
      one(programs, benchmark, options(share)),
      two(programs, benchmark, options(share)) {
  std::filesystem::create_directory(share);
  one.start();
  two.start();
}

Account::~Account() {
  one.stop();
  two.stop();
  std::filesystem::remove_all(folder);
}

void Account::measureSwitches() {
  const auto from = one.client(), to = two.client(), announcements = two.hearthdClient();
  watch(*announcements, pairwell::names::settingsChanged);
  std::vector<double> times;
  for (std::size_t count = 0; count < switches; ++count) {
    const double start = now();
    switchTo(true, *from, *to, *announcements);
    times.push_back((now() - start) / 1000);
    switchTo(false, *from, *to, *announcements);
  }
  report("on at one device to on at another", percentiles(times), "ms");
}

void Account::measureCatchingUp() {
  control(two, "stop");
  Store here(one), there(two);
  const auto key = [](int number) { return "bench" + std::to_string(number); };
  for (int number = 0; number < changes; ++number) {
    if (!here.store->write(std::int64_t{number}, key(number))) throw std::runtime_error("a change failed");
  }
  const std::string documents = share + "/bench/";
  await("the changes are not published", [&] {
    const auto names = here.files.list(documents);
    for (const std::string& name : names ? *names : std::vector<std::string>()) {
      const auto text = platform::linux_::readFile(here.files, documents + name, 1 << 20);
      if (text && text->find(key(changes - 1)) != std::string::npos) return true;
    }
    return false;
  });
  const double start = now();
  control(two, "start");
  await("the other does not catch up",
        [&] { return there.store->dictionaryRepresentation().contains(key(changes - 1)); });
  report("catching up with 1000 changes, start included", (now() - start) / 1000, "ms");
}

}  // namespace bench
