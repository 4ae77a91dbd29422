// What the same work costs as there is more of everything else.
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "bench/Account.hpp"
#include "bench/Client.hpp"
#include "bench/Clock.hpp"
#include "bench/Companion.hpp"
#include "bench/Peers.hpp"
#include "bench/Subjects.hpp"
#include "cloudsyncd/core/Document.hpp"
#include "hearthd/AlarmFile.hpp"
#include "platform/EventStreams.hpp"
#include "platform/linux/FileUserPreferences.hpp"
#include "platform/linux/LinuxFileSystem.hpp"

namespace bench {
namespace {

namespace fs = std::filesystem;
using platform::linux_::LinuxFileSystem;

constexpr int sizes[] = {10, 100, 1000, 10'000};

std::vector<double> times(std::size_t count, const auto& work) {
  std::vector<double> all;
  for (std::size_t done = 0; done < count; ++done) {
    const double start = now();
    work(done);
    all.push_back(now() - start);
  }
  return all;
}

// Other connections are there, and idle.
void growConnections(const std::string& programs) {
  Device device(programs);
  device.start();
  device.client();
  const Bus daemon(Bus::Kind::daemon, programs), broker(Bus::Kind::broker, programs);
  Table& reads = table("growth-connections", "A call beside idle connections, p50 by connections", "µs");
  struct Row {
    const char* name;
    Service service;
    const char* operation;
  };
  for (const Row& row : {Row{"status", device.service(), "GetDistributedLoggingStatus"},
                         {"echo behind dbus-daemon", daemon.echo(), "Echo"},
                         {"echo behind dbus-broker", broker.echo(), "Echo"}}) {
    const std::string message = callMessage(row.service, row.operation);
    std::vector<std::unique_ptr<Client>> idle;
    for (const std::size_t size : {1, 10, 100, 1000}) {
      while (idle.size() + 1 < size) idle.push_back(std::make_unique<Client>(row.service));
      Client client(row.service);
      for (int round = 0; round < rounds; ++round)
        reads.add(row.name, std::to_string(size),
                  percentiles(times(3'000, [&](std::size_t) { client.call(message); })).p50);
    }
  }
  for (const char* size : {"1", "1000"}) reads.compare("status", size, "echo behind dbus-broker");
  reads.print();
}

// A store with so many keys in it, in one step.
void fill(LinuxFileSystem& files, const std::string& path, int keys) {
  const auto file = platform::linux_::SettingsFile::create(files, path);
  const auto filled = file->update([&](platform::Dictionary& document) {
    platform::Dictionary values;
    for (int number = 0; number < keys; ++number) values.emplace("key" + std::to_string(number), number);
    document.insert_or_assign("values", std::move(values));
    return true;
  });
  if (!filled) throw std::runtime_error("a store cannot be filled: " + filled.error().message());
}

void growStores(const std::string& programs) {
  const fakes::TemporaryFolder folder, settings;
  ::setenv("XDG_CONFIG_HOME", settings.path.c_str(), 1);
  ::setenv("XDG_RUNTIME_DIR", settings.path.c_str(), 1);
  const Bus bus(Bus::Kind::daemon, programs);
  ::setenv("DBUS_SESSION_BUS_ADDRESS", bus.address().c_str(), 1);
  LinuxFileSystem files{nullptr};
  Table& writes = table("growth-writes", "A durable write to a store, p50 by keys", "µs");
  Table& reads = table("growth-reads", "A read of a store, p50 by keys", "µs");
  for (const int size : sizes) {
    const std::string path = folder.path + "/" + std::to_string(size) + ".json",
                      column = std::to_string(size);
    fill(files, path, size);
    const auto store = platform::linux_::FileUserPreferences::create(files, nullptr, path);
    Companion dconf({programs + "/pairwell_dconf", "write", column});
    for (int round = 0; round < rounds; ++round) {
      writes.add("user preferences", column, percentiles(times(40, [&](std::size_t count) {
                                               store->setValue(static_cast<std::int64_t>(count) + round * 100,
                                                               "key0");
                                             })).p50);
      writes.add("bare calls of a file of that size", column,
                 percentiles(bareDurableWrites(folder.path, 40, 1, fs::file_size(path))).p50);
      std::vector<double> waits;
      for (int count = 0; count < 40; ++count) {
        dconf.goOn();
        const double start = dconf.moment();
        waits.push_back(dconf.moment() - start);
      }
      writes.add("dconf", column, percentiles(waits).p50);
      reads.add("user preferences", column,
                percentiles(times(2'000, [&](std::size_t) { store->doubleForKey("key5"); })).p50);
    }
  }
  for (const int size : sizes) {
    writes.compare("user preferences", std::to_string(size), "dconf");
    reads.watch("user preferences", std::to_string(size));
  }
  writes.print();
  reads.print();
}

void growAlarms(const std::string& programs) {
  Table& alarms = table("growth-alarms", "One alarm more, durably, p50 by alarms", "µs");
  LinuxFileSystem files{nullptr};
  for (const int size : sizes) {
    Device device(programs);
    hearth::Alarms stored;
    const platform::Date future{4'000'000'000'000'000'000};
    for (int number = 0; number < size; ++number)
      stored.set({"com.kestrel.pairwelld", std::string(platform::EventStreams::alarms),
                  "bench" + std::to_string(number)},
                 future);
    const std::string path = device.paths().alarms();
    if (!hearth::AlarmFile(files, path).save(stored)) throw std::runtime_error("alarms cannot be stored");
    device.start();
    device.client();
    Client client(device.hearthdService());
    const std::string column = std::to_string(size);
    for (int round = 0; round < rounds; ++round) {
      alarms.add("hearthd", column,
                 percentiles(times(40, [&](std::size_t count) {
                   client.call(callMessage(device.hearthdService(), "SetEvent",
                                           {std::string(platform::EventStreams::alarms), "bench0",
                                            static_cast<std::int64_t>(future.nanoseconds - 1 -
                                                                      static_cast<std::int64_t>(count))}));
                 })).p50);
      alarms.add("bare calls of a file of that size", column,
                 percentiles(bareDurableWrites(device.paths().var, 40, 1, fs::file_size(path))).p50);
    }
    alarms.compare("hearthd", column, "bare calls of a file of that size");
  }
  alarms.print();
}

// The others' documents are there, as if they had published once.
void growAccount(const std::string& programs) {
  const fakes::TemporaryFolder share;
  Table& switches = table("growth-devices", "On at one device to on at another, by devices", "ms");
  Account account(programs, "--cloud dir:" + share.path + " --account bench");
  account.timeSwitches(20);
  std::string problem;
  platform::Dictionary entries;
  for (const auto& file : fs::directory_iterator(share.path + "/bench")) {
    const auto document =
        cloudsync::decodeDocument(fakes::contents(file.path()), "bench", file.path().stem(),
                                  std::chrono::system_clock::now().time_since_epoch(), problem);
    if (document) entries = document->entries;
  }
  int devices = 2;
  for (const int size : {2, 10, 100, 1000}) {
    for (; devices < size; ++devices) {
      const std::string name = "other" + std::to_string(devices);
      const auto text = cloudsync::encodeDocument({"bench", name, "bench", entries});
      std::ofstream(share.path + "/bench/" + name + ".json") << *text;
    }
    account.timeSwitches(20);  // both have read them
    for (int round = 0; round < rounds; ++round)
      switches.add("through a folder", std::to_string(size), percentiles(account.timeSwitches(40)).p50);
    switches.watch("through a folder", std::to_string(size));
  }
  switches.print();
}

}  // namespace

void measureGrowth(const std::string& programs) {
  growConnections(programs);
  growStores(programs);
  growAlarms(programs);
  growAccount(programs);
}

}  // namespace bench
