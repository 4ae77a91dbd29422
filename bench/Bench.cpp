// Measures a whole device beside the bare work, in one run. Usage: pairwell_bench PROGRAMS OUTPUT.json
#include <cstdio>
#include <exception>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "bench/Account.hpp"
#include "bench/Cluster.hpp"
#include "bench/Device.hpp"
#include "bench/Peers.hpp"
#include "bench/Process.hpp"
#include "bench/Report.hpp"
#include "tests/fakes/RealFiles.hpp"

namespace bench {
namespace {

using namespace std::chrono_literals;
using platform::linux_::BusClient;

constexpr std::size_t calls = 20'000;
constexpr std::size_t switches = 200;
constexpr int starts = 20;
constexpr auto idleTime = 30s;

std::vector<double> timeCalls(BusClient& client, const std::string& operation) {
  std::vector<double> times;
  for (std::size_t count = 0; count < calls; ++count) {
    const double start = now();
    call(client, clientInterface(), operation);
    times.push_back(now() - start);
  }
  return times;
}

void measureReads(Device& device) {
  const auto client = device.client();
  const Figure bare = percentiles(pingPongWithHop(calls, 64));
  const Figure status = percentiles(timeCalls(*client, "GetDistributedLoggingStatus"));
  const Figure name = percentiles(timeCalls(*client, "GetCurrentUserGivenName"));
  report("bare socket ping-pong with a thread hop", bare, "us");
  report("status read", status, "us");
  report("given name read", name, "us");
  report("status read / bare ping-pong, p50", status.p50 / bare.p50, "x");
  report("given name / bare ping-pong, p50", name.p50 / bare.p50, "x");
}

// A switch counts as done when its announcement arrives: by then both stores and the alarm are durable.
std::vector<double> timeSwitches(Device& device) {
  const auto client = device.client();
  const auto watcher = device.hearthdClient();
  watch(*watcher, pairwell::names::settingsChanged);
  std::vector<double> times;
  for (std::size_t count = 0; count < switches; ++count) {
    const double start = now();
    call(*client, clientInterface(), "SetKestrelAudioAccessoryLimitedLogging", {count % 2 == 0});
    awaitSignal(*watcher);
    times.push_back(now() - start);
  }
  return times;
}

void measureSwitches(Device& device) {
  // Root flag, cloud flag, end time, alarm.
  constexpr int writes = 4;
  const Figure bare = percentiles(bareDurableWrites(device.paths().var, switches, writes));
  const Figure ours = percentiles(timeSwitches(device));
  report("bare calls of the four durable files", bare, "us");
  report("switch, durable and announced", ours, "us");
  report("switch / bare calls, p50", ours.p50 / bare.p50, "x");
}

void reportMemory(const std::string& name, pid_t pid) {
  report(name + ", resident", residentMebibytes(pid), "MiB");
  report(name + ", resident and not shared", residentMebibytes(pid, "RssAnon"), "MiB");
}

void measureIdle(const std::map<std::string, pid_t>& processes) {
  for (const auto& [name, pid] : processes) reportMemory(name, pid);
  std::this_thread::sleep_for(1s);  // answers to the clients that just left
  std::map<std::string, long> before;
  for (const auto& [name, pid] : processes) before[name] = wakeUps(pid);
  std::this_thread::sleep_for(idleTime);
  for (const auto& [name, pid] : processes)
    report(name + ", wake-ups in 30 idle seconds", static_cast<double>(wakeUps(pid) - before[name]), "");
}

void measureStarts(Device& device) {
  std::vector<double> times;
  for (int count = 0; count < starts; ++count) {
    device.stop();
    const double start = now();
    device.start();
    call(*device.client(), clientInterface(), "GetCurrentUserGivenName");
    times.push_back((now() - start) / 1000);
  }
  report("exec of hearthd to pairwelld's first answer", percentiles(times), "ms");
}

void run(const std::string& programs, const std::string& output) {
  Device device(programs);
  device.start();
  measureReads(device);
  measureSwitches(device);
  measureStarts(device);
  device.client();
  const fakes::TemporaryFolder share;
  Account account(programs, "--cloud dir:" + share.path + " --account bench");
  account.measureSwitches("on at one device to on at another");
  Cluster cluster;
  Account distant(programs, cluster.initOptions());
  distant.measureSwitches("on at one device to on at another, over NATS");
  measureIdle({{"pairwelld", device.job("pairwelld")},
               {"hearthd", device.hearthd()},
               {"cloudsyncd", account.member().job("cloudsyncd")},
               {"cloudsyncd over NATS", distant.member().job("cloudsyncd")}});
  distant.measureLossOfLeaders(cluster);
  account.measureCatchingUp(share.path + "/bench/");
  reportMemory("cloudsyncd with 1000 keys", account.member().job("cloudsyncd"));
  writeReport(output);
}

}  // namespace
}  // namespace bench

int main(int count, char** arguments) {
  if (count != 3) {
    std::fprintf(stderr, "usage: pairwell_bench PROGRAMS OUTPUT.json\n");
    return 2;
  }
  try {
    bench::run(arguments[1], arguments[2]);
  } catch (const std::exception& error) {
    std::fprintf(stderr, "pairwell_bench: %s\n", error.what());
    return 1;
  }
}
