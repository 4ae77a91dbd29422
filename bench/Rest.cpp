// From exec to the first answer, and what everything takes at rest.
#include <algorithm>
#include <chrono>
#include <functional>
#include <iterator>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "bench/Client.hpp"
#include "bench/Clock.hpp"
#include "bench/Peers.hpp"
#include "bench/Subjects.hpp"

namespace bench {
namespace {

using namespace std::chrono_literals;

constexpr auto idleTime = 60s;

// Milliseconds; `start` is followed by calls to what it started until one is answered.
double timeStart(const std::function<Service()>& start, const std::string& operation) {
  const double begin = now();
  awaitAnswer(start(), operation);
  return (now() - begin) / 1000;
}

// What the process holds when so many clients have had an answer.
double connectionKibibytes(pid_t pid, const Service& service, const std::string& call, Table& memory,
                           const std::string& row) {
  constexpr int count = 1000;
  const double before = residentMebibytes(pid);
  std::vector<std::unique_ptr<Client>> clients;
  for (int made = 0; made < count; ++made) {
    clients.push_back(std::make_unique<Client>(service));
    clients.back()->call(call);
  }
  const double after = residentMebibytes(pid);
  memory.add(row, "at 1,000 connections", after);
  return (after - before) * 1024 / count;
}

}  // namespace

void measureStarts(const std::string& programs) {
  constexpr std::size_t each = 20;
  const std::string ours = "hearthd, then pairwelld", direct = "sd-bus echo service",
                    behindBroker = "dbus-broker, then the echo service";
  Table& starts = table("starts", "From exec to the first answer", "ms");
  for (int round = 0; round < rounds; ++round) {
    std::vector<double> own, echo, broker;
    Device device(programs);
    for (std::size_t count = 0; count < each; ++count) {
      own.push_back(timeStart(
          [&] {
            device.start();
            return device.service();
          },
          "GetCurrentUserGivenName"));
      device.stop();
      std::optional<DirectEcho> peer;
      echo.push_back(timeStart([&] { return peer.emplace(programs).service(); }, "Echo"));
      const double begin = now();
      const Bus bus(Bus::Kind::broker, programs);  // returns with an answer
      broker.push_back((now() - begin) / 1000);
    }
    starts.add(ours, "p50", percentiles(own).p50);
    starts.add(direct, "p50", percentiles(echo).p50);
    starts.add(behindBroker, "p50", percentiles(broker).p50);
  }
  starts.watch(ours, "p50", 15);
  starts.compare(ours, "p50", direct);
  starts.compare(ours, "p50", behindBroker);
  starts.print();
}

void measureRest(const std::string& programs) {
  const Neighbours all(programs);
  const DirectEcho echo(programs);
  struct Row {
    std::string name;
    pid_t pid;
    Service service;
    const char* call;
  };
  const Device& device = all.device;
  const std::vector<Row> rows{
      {"pairwelld", device.job("pairwelld"), device.service(), "GetDistributedLoggingStatus"},
      {"hearthd", device.hearthd(), device.hearthdService(), "ListJobs"},
      {"sd-bus echo service", echo.pid(), echo.service(), "Echo"},
      {"dbus-broker, without the echo service", all.broker.pid(), all.broker.echo(), "Echo"},
      {"dbus-daemon", all.daemon.pid(), all.daemon.echo(), "Echo"}};
  Table& memory = table("memory", "Resident memory", "MiB");
  Table& connections = table("connections", "Memory of a connection", "KiB");
  Table& wakes = table("wakeups", "Wake-ups in 60 idle seconds", "");
  for (const Row& row : rows) Client(row.service).call(callMessage(row.service, row.call));
  std::this_thread::sleep_for(1s);  // the clients have just left
  std::vector<long> before, threads;
  std::transform(rows.begin(), rows.end(), std::back_inserter(before),
                 [](const Row& row) { return wakeUps(row.pid); });
  std::transform(rows.begin(), rows.end(), std::back_inserter(threads),
                 [](const Row& row) { return statusNumber(row.pid, "Threads"); });
  std::this_thread::sleep_for(idleTime);
  for (std::size_t index = 0; index < rows.size(); ++index) {
    const Row& row = rows[index];
    const long woken = wakeUps(row.pid) - before[index];
    if (statusNumber(row.pid, "Threads") != threads[index])
      throw std::runtime_error(row.name + ": a thread has ended, and its wake-ups with it");
    wakes.add(row.name, "wake-ups", static_cast<double>(woken));
    memory.add(row.name, "idle", residentMebibytes(row.pid));
  }
  for (const Row& row : rows)
    connections.add(
        row.name, "KiB",
        connectionKibibytes(row.pid, row.service, callMessage(row.service, row.call), memory, row.name));
  for (const char* ours : {"pairwelld", "hearthd"}) {
    memory.watch(ours, "idle", 6);
    memory.compare(ours, "idle", "dbus-broker, without the echo service");
    connections.watch(ours, "KiB", 10);
    connections.compare(ours, "KiB", "dbus-broker, without the echo service");
    wakes.watch(ours, "wake-ups", 0);
  }
  for (const Table* each : {&memory, &connections, &wakes}) each->print();
}

}  // namespace bench
