// Measures what accounts and devices cost a NATS cluster. Usage: pairwell_scale PROGRAMS FOLDER
#include <sys/stat.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <exception>
#include <filesystem>
#include <functional>
#include <future>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <type_traits>
#include <utility>
#include <vector>

#include "bench/Cluster.hpp"
#include "bench/Device.hpp"
#include "bench/Peers.hpp"
#include "bench/Process.hpp"
#include "bench/Report.hpp"
#include "cloudsyncd/NatsConnection.hpp"

namespace bench {
namespace {

using namespace std::chrono_literals;
using cloudsync::NatsConnection;
using Connection = std::shared_ptr<NatsConnection>;

constexpr std::size_t steps[] = {10, 100, 1000};
constexpr std::size_t mostAccounts = steps[2];
constexpr std::size_t devicesOfAccount = 4;
constexpr int publishes = 200;
constexpr auto idleTime = 10s;

// A stream that was just made may be without its leader. What goes on failing ends the measurement.
template <class Action>
auto insist(Action action) {
  std::string problem;
  auto done = action(problem);
  const double end = now() + 60e6;
  while (!done && now() < end) {
    std::this_thread::sleep_for(1ms);
    done = action(problem);
  }
  if (!done) throw std::runtime_error(problem);
  if constexpr (!std::is_same_v<decltype(done), platform::Result<void>>) return std::move(*done);
}

Connection open(const Cluster& cluster, std::size_t account, std::size_t server) {
  cloudsync::NatsAccess access;
  access.user = Cluster::account(account);
  access.password = Cluster::password();
  access.isEncrypted = false;
  return insist([&](std::string& problem) {
    return NatsConnection::open(cluster.address(server % Cluster::size), access, access.user, problem);
  });
}

void publish(NatsConnection& to, const std::string& device, const std::string& document) {
  insist([&](std::string& problem) { return to.publish(device, document, problem); });
}

std::string device(std::size_t number) { return "device-" + std::to_string(number); }

Figure publishTime(NatsConnection& to, const std::string& document) {
  std::vector<double> times;
  for (int count = 0; count < publishes; ++count) {
    const double start = now();
    publish(to, device(0), document);
    times.push_back((now() - start) / 1000);
  }
  return percentiles(times);
}

// What a device with a running period publishes.
std::string realDocument(const std::string& programs, const Cluster& cluster) {
  Device real(programs, cluster.initOptions());
  real.start();
  call(*real.client(), clientInterface(), "SetKestrelAudioAccessoryLimitedLogging", {true});
  const Connection reader = open(cluster, 0, 0);
  std::string document;
  await("no device publishes", [&] {
    std::string problem;
    const auto stream = reader->stream(problem);
    for (const std::string& name : stream ? stream->devices : std::vector<std::string>()) {
      if (auto found = reader->document(name, problem)) document = *found;
    }
    return document.find("Expiration") != std::string::npos;
  });
  return document;
}

void each(const std::string& what, const char* unit, const std::function<double(std::size_t)>& figure) {
  std::vector<double> figures;
  for (std::size_t number = 0; number < Cluster::size; ++number) figures.push_back(figure(number));
  report(what, figures, unit);
}

double diskKibibytes(const std::string& folder) {
  double blocks = 0;
  struct stat seen;
  for (const auto& file : std::filesystem::recursive_directory_iterator(folder)) {
    if (::lstat(file.path().c_str(), &seen) == 0) blocks += static_cast<double>(seen.st_blocks);
  }
  return blocks / 2;
}

void reportServers(const Cluster& cluster, const std::string& of) {
  each(of + ", resident", "MiB", [&](auto number) { return residentMebibytes(cluster.process(number)); });
  each(of + ", disk", "KiB", [&](auto number) { return diskKibibytes(cluster.folder(number)); });
  each(of + ", descriptors", "",
       [&](auto number) { return static_cast<double>(openDescriptors(cluster.process(number))); });
  each(of + ", threads", "",
       [&](auto number) { return static_cast<double>(statusNumber(cluster.process(number), "Threads")); });
  std::vector<double> before;
  for (std::size_t number = 0; number < Cluster::size; ++number)
    before.push_back(processorSeconds(cluster.process(number)));
  std::this_thread::sleep_for(idleTime);
  each(of + ", processor when idle", "%", [&](auto number) {
    return (processorSeconds(cluster.process(number)) - before[number]) * 100 /
           std::chrono::duration<double>(idleTime).count();
  });
}

// One account, all of its devices connected.
void measureDevices(const std::string& document) {
  Cluster cluster;
  reportServers(cluster, "0 devices");
  std::vector<Connection> connections;
  for (const std::size_t count : steps) {
    std::printf("connecting %zu devices\n", count);
    while (connections.size() < count) {
      connections.push_back(open(cluster, 0, connections.size()));
      insist([&](std::string& problem) { return connections.back()->stream(problem); });
      publish(*connections.back(), device(connections.size() - 1), document);
    }
    const std::string of = std::to_string(count) + " devices";
    reportServers(cluster, of);
    const auto counted = [&](const char* what, const char* path, const char* field) {
      each(of + ", " + what, "",
           [&](auto number) { return static_cast<double>(cluster.count(number, path, field)); });
    };
    counted("connections", "connz", "total");
    counted("subscriptions", "subsz", "num_subscriptions");
    counted("bytes in the stream", "jsz", "bytes");
    report(of + ", publish", publishTime(*connections[0], document), "ms");
    const double start = now();
    const Connection reader = open(cluster, 0, 0);
    const auto stream = insist([&](std::string& problem) { return reader->stream(problem); });
    for (const std::string& name : stream.devices)
      insist([&](std::string& problem) { return reader->document(name, problem); });
    report(of + ", connecting and reading all", (now() - start) / 1000, "ms");
  }
}

// Killed is the server that leads the most.
void measureLossOfLeader(Cluster& cluster, std::size_t accounts) {
  std::size_t most = 0, led = 0;
  for (std::size_t number = 0; number < Cluster::size; ++number) {
    const std::size_t leads = cluster.streamsLedBy(number).size();
    if (leads > led) led = leads, most = number;
  }
  const double start = now();
  cluster.kill(most);
  report("streams that lost their leader", static_cast<double>(led), "");
  std::size_t former = 0;
  await(
      "streams stay without a leader",
      [&] {
        std::size_t have = 0;
        for (std::size_t number = 0; number < Cluster::size; ++number)
          have += cluster.streamsLedBy(number).size();
        if (have != former)
          std::printf("  %6.1f s: %zu streams have a leader\n", (now() - start) / 1e6, have);
        former = have;
        std::this_thread::sleep_for(200ms);
        return have >= accounts;
      },
      300s);
  report("until all have one again", (now() - start) / 1e6, "s");
}

// A stream's first election takes a while, most of it waiting; so several are made at a time.
void makeAccounts(const Cluster& cluster, std::size_t from, std::size_t to, const std::string& document) {
  const double start = now();
  std::atomic<std::size_t> next = from;
  const auto work = [&] {
    for (std::size_t made; (made = next++) < to;) {
      if (made % 100 == 0) std::printf("  account %zu, %.1f s\n", made, (now() - start) / 1e6);
      const Connection connection = open(cluster, made, made);
      insist([&](std::string& problem) { return connection->stream(problem); });
      for (std::size_t number = 0; number < devicesOfAccount; ++number)
        publish(*connection, device(number), document);
    }
  };
  std::vector<std::future<void>> makers;
  makers.reserve(8);
  while (makers.size() < 8) makers.push_back(std::async(std::launch::async, work));
  for (std::future<void>& maker : makers) maker.get();
  report(std::to_string(to) + " accounts, the last " + std::to_string(to - from) + " made within",
         (now() - start) / 1e6, "s");
}

// No device of theirs is connected.
void measureAccounts(const std::string& document) {
  Cluster cluster(mostAccounts);
  reportServers(cluster, "0 accounts");
  std::size_t made = 0;
  for (const std::size_t count : steps) {
    makeAccounts(cluster, std::exchange(made, count), count, document);
    const std::string of = std::to_string(count) + " accounts";
    reportServers(cluster, of);
    report(of + ", publish", publishTime(*open(cluster, 0, 0), document), "ms");
  }
  measureLossOfLeader(cluster, mostAccounts);
}

// The same documents as subjects of one stream.
void measureSharedStream(const std::string& document) {
  Cluster cluster;
  const Connection connection = open(cluster, 0, 0);
  insist([&](std::string& problem) { return connection->stream(problem); });
  for (std::size_t number = 0; number < mostAccounts * devicesOfAccount; ++number)
    publish(*connection, device(number), document);
  reportServers(cluster, "1 stream of " + std::to_string(mostAccounts) + " accounts");
}

void run(const std::string& programs, const std::string& folder) {
  std::string document;
  {
    const Cluster cluster;
    document = realDocument(programs, cluster);
  }
  report("a document", static_cast<double>(document.size()), "B");
  measureDevices(document);
  measureSharedStream(document);
  measureAccounts(document);
  writeReport(folder, "scale");
}

}  // namespace
}  // namespace bench

int main(int count, char** arguments) {
  if (count != 3) {
    std::fprintf(stderr, "usage: pairwell_scale PROGRAMS FOLDER\n");
    return 2;
  }
  std::setvbuf(stdout, nullptr, _IOLBF, 0);
  try {
    bench::run(arguments[1], arguments[2]);
  } catch (const std::exception& error) {
    std::fprintf(stderr, "pairwell_scale: %s\n", error.what());
    return 1;
  }
}
