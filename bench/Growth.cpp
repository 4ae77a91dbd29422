// What the same work costs as there is more of everything else.
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "bench/Account.hpp"
#include "bench/Client.hpp"
#include "bench/Clock.hpp"
#include "bench/Peers.hpp"
#include "bench/Subjects.hpp"
#include "cloudsyncd/core/Document.hpp"
#include "hearthd/core/Alarms.hpp"
#include "platform/EventStreams.hpp"
#include "platform/linux/FileUserPreferences.hpp"
#include "platform/linux/Json.hpp"
#include "platform/linux/LinuxFileSystem.hpp"

namespace bench {
namespace {

namespace fs = std::filesystem;
using platform::linux_::LinuxFileSystem;

constexpr int sizes[] = {10, 100, 1000, 10'000};

double median(const std::vector<double>& times) { return percentiles(times).p50; }

// Other connections are there, and idle.
void growConnections(const std::string& programs) {
  const Neighbours neighbours(programs);
  const std::string ours = "status", behindBroker = "echo behind dbus-broker";
  struct Row {
    std::string name;
    Service service;
    const char* operation;
    std::vector<std::unique_ptr<Client>> idle = {};
  };
  std::vector<Row> all;
  all.push_back({ours, neighbours.device.service(), "GetDistributedLoggingStatus"});
  all.push_back({"echo behind dbus-daemon", neighbours.daemon.echo(), "Echo"});
  all.push_back({behindBroker, neighbours.broker.echo(), "Echo"});
  Table& reads = table("growth-connections", "A call beside idle connections, p50 by connections", "µs");
  for (const std::size_t size : {1, 10, 100, 1000}) {
    for (Row& row : all) {
      while (row.idle.size() + 1 < size) row.idle.push_back(std::make_unique<Client>(row.service));
    }
    for (int round = 0; round < rounds; ++round) {
      for (const Row& row : all) {
        const std::string message = callMessage(row.service, row.operation);
        Client client(row.service);
        reads.add(row.name, std::to_string(size),
                  median(times(3'000, [&](std::size_t) { client.call(message); })));
      }
    }
    reads.compare(ours, std::to_string(size), behindBroker);
  }
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
  const fakes::TemporaryFolder folder;
  LinuxFileSystem files{nullptr};
  const std::string ours = "user preferences", bare = "bare calls of a file of that size";
  Table& writes = table("growth-writes", "A write to a store, p50 by keys", "µs");
  Table& reads = table("growth-reads", "A read of a store, p50 by keys", "µs");
  for (const int size : sizes) {
    const std::string column = std::to_string(size), path = folder.path + "/" + column + ".json";
    fill(files, path, size);
    const auto store = platform::linux_::FileUserPreferences::create(files, nullptr, path);
    Dconf dconf(programs, size);
    std::int64_t value = 0;
    for (int round = 0; round < rounds; ++round) {
      writes.add(ours, column, median(times(40, [&](std::size_t) { store->setValue(++value, "key0"); })));
      writes.add(bare, column, median(bareDurableWrites(folder.path, 40, 1, fs::file_size(path))));
      std::vector<double> waits;
      for (int count = 0; count < 40; ++count) waits.push_back(dconf.write().returned);
      writes.add("dconf, not durable", column, median(waits));
      reads.add(ours, column, median(times(2'000, [&](std::size_t) { store->doubleForKey("key5"); })));
    }
    writes.compare(ours, column, bare);
    reads.watch(ours, column);
  }
  writes.print();
  reads.print();
}

void growAlarms(const std::string& programs) {
  const std::string stream(platform::EventStreams::alarms), bare = "bare calls of a file of that size";
  constexpr std::int64_t future = 4'000'000'000'000'000'000;
  Table& alarms = table("growth-alarms", "One alarm more, durably, p50 by alarms", "µs");
  for (const int size : sizes) {
    Device device(programs);
    hearth::Alarms stored;
    for (int number = 0; number < size; ++number)
      stored.set({"com.kestrel.pairwelld", stream, "bench" + std::to_string(number)}, {future});
    const std::string path = device.paths().alarms(), column = std::to_string(size);
    fs::create_directories(fs::path(path).parent_path());
    std::ofstream(path) << *platform::linux_::printJson(stored.toValue(),
                                                        platform::linux_::JsonStyle::indented);
    device.start();
    device.client();
    Client client(device.hearthdService());
    std::int64_t date = future;
    for (int round = 0; round < rounds; ++round) {
      alarms.add("hearthd", column, median(times(40, [&](std::size_t) {
                   client.call(callMessage(device.hearthdService(), "SetEvent", {stream, "bench0", --date}));
                 })));
      alarms.add(bare, column, median(bareDurableWrites(device.paths().var, 40, 1, fs::file_size(path))));
    }
    alarms.compare("hearthd", column, bare);
  }
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
  int devices = 2;
  for (const int size : {2, 10, 100, 1000}) {
    for (; devices < size; ++devices) {
      const std::string name = "other" + std::to_string(devices);
      const auto text = cloudsync::encodeDocument({"bench", name, "bench", entries});
      std::ofstream(share.path + "/bench/" + name + ".json") << *text;
    }
    account.timeSwitches(20);
    for (int round = 0; round < rounds; ++round)
      switches.add("through a folder", std::to_string(size), median(account.timeSwitches(40)));
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
