// Measures a whole device beside the bare work, in one run. Usage: pairwell_bench PROGRAMS OUTPUT.json
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <functional>
#include <stdexcept>
#include <string>
#include <thread>

#include "bench/Device.hpp"
#include "bench/Peers.hpp"
#include "platform/linux/BusServiceListener.hpp"
#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/Json.hpp"

namespace bench {
namespace {

using namespace std::chrono_literals;
using platform::Dictionary;
using platform::List;
using platform::Value;
using platform::linux_::BusClient;

constexpr std::size_t calls = 20'000;
constexpr std::size_t switches = 200;
constexpr int starts = 20;
constexpr auto idleTime = 30s;

struct Figure {
  double p50, p99;
};

Figure percentiles(std::vector<double> times) {
  std::sort(times.begin(), times.end());
  return {times.at(times.size() / 2), times.at(times.size() * 99 / 100)};
}

Dictionary results;

void report(const char* what, Figure figure, const char* unit) {
  std::printf("%-46s p50 %9.1f %s   p99 %9.1f %s\n", what, figure.p50, unit, figure.p99, unit);
  std::fflush(stdout);
  results.emplace(what, Dictionary{{"p50", figure.p50}, {"p99", figure.p99}, {"unit", unit}});
}

void report(const char* what, double figure, const char* unit) {
  std::printf("%-46s %13.2f %s\n", what, figure, unit);
  std::fflush(stdout);
  results.emplace(what, Dictionary{{"value", figure}, {"unit", unit}});
}

const platform::linux_::BusInterface& clientInterface() {
  static const auto interface = platform::linux_::clientInterface(pairwell::names::service);
  return interface;
}

void mustAnswer(const platform::Result<platform::linux_::BusReply>& reply) {
  if (!reply || !std::holds_alternative<List>(*reply)) throw std::runtime_error("a call failed");
}

std::vector<double> timeCalls(BusClient& client, const std::string& operation) {
  std::vector<double> times;
  for (std::size_t call = 0; call < calls; ++call) {
    const double start = now();
    mustAnswer(client.call(clientInterface(), operation, {}, 5s));
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
  auto watcher = BusClient::connect(device.paths().hearthdSocket(), 5s);
  if (!watcher) throw std::runtime_error("hearthd does not answer");
  mustAnswer((*watcher)->call(platform::linux_::hearthInterface(), "Watch",
                              {std::string(pairwell::names::settingsChanged)}, 5s));
  std::vector<double> times;
  for (std::size_t count = 0; count < switches; ++count) {
    const double start = now();
    mustAnswer(
        client->call(clientInterface(), "SetKestrelAudioAccessoryLimitedLogging", {count % 2 == 0}, 5s));
    const auto signal = (*watcher)->nextSignal(5s);
    if (!signal || !*signal) throw std::runtime_error("a switch was not announced");
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

long statusNumber(pid_t pid, const std::string& task, const std::string& field) {
  std::ifstream status("/proc/" + std::to_string(pid) + task + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.compare(0, field.size(), field) == 0) return std::stol(line.substr(field.size() + 1));
  }
  throw std::runtime_error("no " + field);
}

long wakeUps(pid_t pid) {
  long sum = 0;
  for (const auto& task : std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/task")) {
    sum += statusNumber(pid, "/task/" + task.path().filename().string(), "voluntary_ctxt_switches");
  }
  return sum;
}

void measureIdle(Device& device) {
  const pid_t daemon = device.pairwelld();
  report("pairwelld, resident", static_cast<double>(statusNumber(daemon, "", "VmRSS")) / 1024, "MiB");
  report("hearthd, resident", static_cast<double>(statusNumber(device.hearthd(), "", "VmRSS")) / 1024, "MiB");
  report("pairwelld, resident and not shared",
         static_cast<double>(statusNumber(daemon, "", "RssAnon")) / 1024, "MiB");
  std::this_thread::sleep_for(1s);  // answers to the clients that just left
  const long before = wakeUps(daemon), beforeHearthd = wakeUps(device.hearthd());
  std::this_thread::sleep_for(idleTime);
  report("pairwelld, wake-ups in 30 idle seconds", static_cast<double>(wakeUps(daemon) - before), "");
  report("hearthd, wake-ups in 30 idle seconds",
         static_cast<double>(wakeUps(device.hearthd()) - beforeHearthd), "");
}

void measureStarts(Device& device) {
  std::vector<double> times;
  for (int count = 0; count < starts; ++count) {
    device.stop();
    const double start = now();
    device.start();
    mustAnswer(device.client()->call(clientInterface(), "GetCurrentUserGivenName", {}, 5s));
    times.push_back((now() - start) / 1000);
  }
  report("exec of hearthd to pairwelld's first answer", percentiles(times), "ms");
}

void run(const std::string& programs, const std::string& output) {
  char self[4096];
  const ssize_t length = ::readlink("/proc/self/exe", self, sizeof self);
  Device device(programs, std::string(self, static_cast<std::size_t>(length)));
  device.start();
  measureReads(device);
  measureSwitches(device);
  measureStarts(device);
  device.client();
  measureIdle(device);
  const auto text = platform::linux_::printJson(results, platform::linux_::JsonStyle::indented);
  if (!text || !(std::ofstream(output) << *text << '\n')) throw std::runtime_error("cannot write " + output);
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
