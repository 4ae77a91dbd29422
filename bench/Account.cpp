#include "bench/Account.hpp"

#include <algorithm>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <stdexcept>
#include <thread>
#include <vector>

#include "bench/Clock.hpp"
#include "bench/Process.hpp"
#include "bench/Report.hpp"
#include "bench/Subjects.hpp"
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

constexpr int changes = 1000;

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

void reportRest(const std::string& name, pid_t pid) {
  report(name + ", resident", residentMebibytes(pid), "MiB");
  std::this_thread::sleep_for(2s);  // the last switch goes its way
  const long before = wakeUps(pid);
  std::this_thread::sleep_for(60s);
  report(name + ", wake-ups in 60 idle seconds", static_cast<double>(wakeUps(pid) - before), "");
}

}  // namespace

Account::Account(const std::string& programs, const std::string& options)
    : one(programs, options), two(programs, options) {
  one.start();
  two.start();
}

std::vector<double> Account::timeSwitches(std::size_t count) {
  const auto from = one.client(), to = two.client(), announcements = two.hearthdClient();
  watch(*announcements, pairwell::names::settingsChanged);
  std::vector<double> times;
  for (std::size_t done = 0; done <= count; ++done) {
    const double start = now();
    switchTo(true, *from, *to, *announcements);
    if (done > 0) times.push_back((now() - start) / 1000);  // at first the two may not be connected yet
    switchTo(false, *from, *to, *announcements);
  }
  return times;
}

// Each switch is followed by a number of its own, so that it shows which of them the other device has.
void Account::measureLossOfLeaders(Cluster& cluster) {
  constexpr std::int64_t count = 60;
  constexpr double between = 500'000;
  const std::string key = "bench";
  const auto client = one.client(), announcements = one.hearthdClient(), other = two.client();
  watch(*announcements, pairwell::names::settingsChanged);
  Store here(one), there(two);
  std::vector<double> starts;
  double longest = 0;
  std::int64_t seen = 0, overtaken = 0;
  std::optional<std::size_t> killed;
  const auto look = [&] {
    const auto all = there.store->dictionaryRepresentation();
    const auto* number = platform::find<std::int64_t>(all, key);
    const auto found = number ? *number : 0;
    if (found > seen) overtaken += found - seen - 1;
    for (; seen < found; ++seen)
      longest = std::max(longest, now() - starts.at(static_cast<std::size_t>(seen)));
  };
  for (std::int64_t number = 1; number <= count; ++number) {
    if (number == 10 || number == 40) {
      await("the stream has no leader", [&] { return (killed = cluster.leaderOf(Cluster::stream(0))); });
      cluster.kill(*killed);
    } else if (number == 20) {
      cluster.start(*killed);
    }
    starts.push_back(now());
    switchTo(number % 2 != 0, *client, *client, *announcements);
    if (!here.store->write(number, key)) throw std::runtime_error("a change failed");
    for (const double next = starts.back() + between; now() < next; std::this_thread::sleep_for(1ms)) look();
  }
  await("a switch is lost", [&] {
    look();
    return seen == count && here.store->dictionaryRepresentation() == there.store->dictionaryRepresentation();
  });
  await("a switch is not followed", [&] {
    return call(*other, clientInterface(), "KestrelAudioAccessoryLimitedLogging") == platform::List{false};
  });
  report("60 switches, 2 leaders killed, longest wait", longest / 1000, "ms");
  report("60 switches, 2 leaders killed, overtaken", static_cast<double>(overtaken), "");
}

void Account::measureCatchingUp(const std::string& documents) {
  control(two, "stop");
  Store here(one), there(two);
  const auto key = [](int number) { return "bench" + std::to_string(number); };
  for (int number = 0; number < changes; ++number) {
    if (!here.store->write(std::int64_t{number}, key(number))) throw std::runtime_error("a change failed");
  }
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

void measureAccounts(const std::string& programs) {
  const fakes::TemporaryFolder share;
  Account account(programs, "--cloud dir:" + share.path + " --account bench");
  Cluster cluster;
  Account distant(programs, cluster.initOptions());
  Table& switches = table("accounts", "On at one device to on at another", "ms");
  for (int round = 0; round < rounds; ++round) {
    switches.add("through a folder", percentiles(account.timeSwitches(100)));
    switches.add("over NATS, three servers", percentiles(distant.timeSwitches(100)));
  }
  switches.watch("through a folder", "p50", 60);
  switches.watch("through a folder", "p99", 120);
  switches.watch("over NATS, three servers", "p50", 60);
  switches.watch("over NATS, three servers", "p99", 120);
  switches.print();
  reportRest("cloudsyncd, a folder", account.member().job("cloudsyncd"));
  reportRest("cloudsyncd, NATS", distant.member().job("cloudsyncd"));
  distant.measureLossOfLeaders(cluster);
  account.measureCatchingUp(share.path + "/bench/");
  report("cloudsyncd with 1000 keys, resident", residentMebibytes(account.member().job("cloudsyncd")), "MiB");
}

}  // namespace bench
