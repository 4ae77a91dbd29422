// From exec to the first answer, and what everything takes at rest.
#include <sys/resource.h>

#include <chrono>
#include <memory>
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

// `start` returns with the first answer.
template <class Start>
double timeStart(Start start) {
  const double begin = now();
  start();
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
  Table& starts = table("starts", "From exec to the first answer", "ms");
  constexpr std::size_t each = 20;
  for (int round = 0; round < rounds; ++round) {
    std::vector<double> ours, echo, broker;
    Device device(programs);
    for (std::size_t count = 0; count < each; ++count) {
      ours.push_back(timeStart([&] {
        device.start();
        call(*device.client(), clientInterface(), "GetCurrentUserGivenName");
      }));
      device.stop();
      std::unique_ptr<DirectEcho> direct;
      echo.push_back(timeStart([&] {
        direct = std::make_unique<DirectEcho>(programs);
        Client(direct->service()).call(callMessage(direct->service(), "Echo"));
      }));
      std::unique_ptr<Bus> bus;
      broker.push_back(timeStart([&] { bus = std::make_unique<Bus>(Bus::Kind::broker, programs); }));
    }
    starts.add("hearthd, then pairwelld", percentiles(ours));
    starts.add("library's echo service, direct", percentiles(echo));
    starts.add("dbus-broker, then the echo service", percentiles(broker));
  }
  starts.watch("hearthd, then pairwelld", "p50", 15);
  starts.print();
}

void measureRest(const std::string& programs) {
  Device device(programs);
  device.start();
  device.client();
  const Bus daemon(Bus::Kind::daemon, programs), broker(Bus::Kind::broker, programs);
  const DirectEcho echo(programs);
  struct Row {
    std::string name;
    pid_t pid;
    Service service;
    const char* call;
  };
  const std::vector<Row> all{
      {"pairwelld", device.job("pairwelld"), device.service(), "GetDistributedLoggingStatus"},
      {"hearthd", device.hearthd(), device.hearthdService(), "ListJobs"},
      {"library's echo service, direct", echo.pid(), echo.service(), "Echo"},
      {"dbus-broker", broker.pid(), broker.echo(), "Echo"},
      {"dbus-daemon", daemon.pid(), daemon.echo(), "Echo"}};
  Table& memory = table("memory", "Resident memory", "MiB");
  Table& connections = table("connections", "Memory of a connection", "KiB");
  Table& wakes = table("wakeups", "Wake-ups in 60 idle seconds", "");
  for (const Row& row : all) memory.add(row.name, "idle", residentMebibytes(row.pid));
  std::this_thread::sleep_for(1s);  // the clients have just left
  std::vector<long> before;
  for (const Row& row : all) before.push_back(wakeUps(row.pid));
  std::this_thread::sleep_for(idleTime);
  for (std::size_t index = 0; index < all.size(); ++index)
    wakes.add(all[index].name, "wake-ups", static_cast<double>(wakeUps(all[index].pid) - before[index]));
  for (const Row& row : all)
    connections.add(
        row.name, "KiB",
        connectionKibibytes(row.pid, row.service, callMessage(row.service, row.call), memory, row.name));
  memory.watch("pairwelld", "idle", 6);
  memory.watch("hearthd", "idle", 6);
  connections.watch("pairwelld", "KiB", 10);
  for (const Table* each : {&memory, &connections, &wakes}) each->print();
}

}  // namespace bench
