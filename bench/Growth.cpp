// What the same work costs as there is more of everything else.
#include <cstdint>
#include <deque>
#include <filesystem>
#include <fstream>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "bench/Account.hpp"
#include "bench/Client.hpp"
#include "bench/Clock.hpp"
#include "bench/Peers.hpp"
#include "bench/Subjects.hpp"
#include "cloudsyncd/core/Document.hpp"
#include "hearthd/core/Alarms.hpp"
#include "platform/EventStreams.hpp"
#include "platform/linux/EventLoop.hpp"
#include "platform/linux/FileUserPreferences.hpp"
#include "platform/linux/Json.hpp"
#include "platform/linux/LinuxFileSystem.hpp"

namespace bench {
namespace {

namespace fs = std::filesystem;
using platform::linux_::LinuxFileSystem;

constexpr int sizes[] = {10, 100, 1000, 10'000};

// Other connections are there, and idle.
void growConnections(const std::string& programs) {
  const Neighbours neighbours(programs);
  const std::string ours = "status", behindBroker = "echo behind dbus-broker";
  struct Row {
    std::string name;
    Service service;
    const char* operation;
  };
  const Row all[] = {{ours, neighbours.device.service(), "GetDistributedLoggingStatus"},
                     {"echo behind dbus-daemon", neighbours.daemon.echo(), "Echo"},
                     {behindBroker, neighbours.broker.echo(), "Echo"}};
  Table& reads = table("growth-connections", "A call beside idle connections, p50 by connections", "µs");
  for (int round = 0; round < rounds; ++round) {
    for (const std::size_t size : {1, 10, 100, 1000}) {
      for (const Row& row : all) {
        std::vector<std::unique_ptr<Client>> idle;
        while (idle.size() + 1 < size) idle.push_back(std::make_unique<Client>(row.service));
        const std::string message = callMessage(row.service, row.operation);
        Client client(row.service);
        const auto waits = times(3'000, [&](std::size_t) { client.call(message); });
        reads.add(row.name, std::to_string(size), percentiles(waits).p50);
        idle.clear();
        client.call(message);  // behind their ends
      }
    }
  }
  for (const char* size : {"1", "10", "100", "1000"}) reads.compare(ours, size, behindBroker);
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

// Serves the stores' watches.
struct Loop : platform::linux_::EventLoop {
  ~Loop() {
    stop();
    thread.join();
  }
  std::thread thread{[this] { run(); }};
};

// Of both, the same number of keys.
struct Stores {
  Stores(const std::string& programs, Loop& loop, LinuxFileSystem& files, const std::string& folder, int keys)
      : column(std::to_string(keys)), path(folder + "/" + column + ".json"), dconf(programs, keys) {
    fill(files, path, keys);
    own = platform::linux_::FileUserPreferences::create(files, &loop, path);
  }
  const std::string column, path;
  Dconf dconf;
  std::shared_ptr<platform::linux_::FileUserPreferences> own;
};

void growStores(const std::string& programs) {
  constexpr std::size_t writesOfARound = 20;
  const fakes::TemporaryFolder folder;
  Loop loop;
  LinuxFileSystem files{&loop};
  const std::string ours = "user preferences", bare = "bare calls of a file of that size",
                    peer = "dconf, not durable";
  Table& writes = table("growth-writes", "A write to a store, p50 by keys", "µs");
  Table& reads = table("growth-reads", "A read of a store, p50 by keys", "µs");
  std::deque<Stores> all;
  for (const int size : sizes) all.emplace_back(programs, loop, files, folder.path, size);
  std::int64_t value = 0;
  for (int round = 0; round < rounds; ++round) {
    for (Stores& stores : all) {
      const auto add = [&](Table& table, const std::string& row, const std::vector<double>& waits) {
        table.add(row, stores.column, percentiles(waits).p50);
      };
      add(writes, ours, times(writesOfARound, [&](std::size_t) { stores.own->setValue(++value, "key0"); }));
      add(writes, bare, bareDurableWrites(folder.path, writesOfARound, 1, fs::file_size(stores.path)));
      std::vector<double> waits;
      while (waits.size() < writesOfARound) waits.push_back(stores.dconf.write().returned);
      add(writes, peer, waits);
      add(reads, ours, times(2'000, [&](std::size_t) { stores.own->doubleForKey("key5"); }));
    }
  }
  for (const Stores& stores : all) {
    writes.compare(ours, stores.column, bare);
    writes.compare(ours, stores.column, peer);
    reads.watch(ours, stores.column);
  }
  writes.print();
  reads.print();
}

// A device whose alarms are there before it starts.
struct Alarmed {
  Alarmed(const std::string& programs, int alarms) : column(std::to_string(alarms)), device(programs) {
    hearth::Alarms stored;
    for (int number = 0; number < alarms; ++number)
      stored.set({"com.kestrel.pairwelld", stream, "bench" + std::to_string(number)}, {future});
    fs::create_directories(fs::path(device.paths().alarms()).parent_path());
    std::ofstream(device.paths().alarms())
        << *platform::linux_::printJson(stored.toValue(), platform::linux_::JsonStyle::indented);
    device.start();
    device.client();
  }
  static constexpr std::int64_t future = 4'000'000'000'000'000'000;
  static inline const std::string stream{platform::EventStreams::alarms};
  const std::string column;
  Device device;
};

void growAlarms(const std::string& programs) {
  const std::string ours = "hearthd", bare = "bare calls of a file of that size";
  Table& alarms = table("growth-alarms", "An alarm set to another date, p50 by alarms", "µs");
  std::deque<Alarmed> all;
  for (const int size : sizes) all.emplace_back(programs, size);
  std::int64_t date = Alarmed::future;
  for (int round = 0; round < rounds; ++round) {
    for (Alarmed& alarmed : all) {
      const Service service = alarmed.device.hearthdService();
      Client client(service);
      const auto waits = times(40, [&](std::size_t) {
        client.call(callMessage(service, "SetEvent", {Alarmed::stream, "bench0", --date}));
      });
      alarms.add(ours, alarmed.column, percentiles(waits).p50);
      const auto size = fs::file_size(alarmed.device.paths().alarms());
      alarms.add(bare, alarmed.column,
                 percentiles(bareDurableWrites(alarmed.device.paths().var, 40, 1, size)).p50);
    }
  }
  for (const Alarmed& alarmed : all) alarms.compare(ours, alarmed.column, bare);
  alarms.print();
}

// The others' documents are there, as if they had published once.
void growAccount(const std::string& programs) {
  const fakes::TemporaryFolder share;
  Table& switches = table("growth-devices", "On at one device to on at another, p50 by devices", "ms");
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
  if (entries.empty()) throw std::runtime_error("no device has published: " + problem);
  int devices = 2;
  for (const int size : {2, 10, 100, 1000}) {
    for (; devices < size; ++devices) {
      const std::string name = "other" + std::to_string(devices);
      const auto text = cloudsync::encodeDocument({"bench", name, "bench", entries});
      std::ofstream(share.path + "/bench/" + name + ".json") << *text;
    }
    account.timeSwitches(20);
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
