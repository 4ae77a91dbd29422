// Changes that must last: a switch until it is announced, and a value until another process has it.
#include <sys/inotify.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <fstream>
#include <memory>
#include <string>

#include "bench/Client.hpp"
#include "bench/Clock.hpp"
#include "bench/Companion.hpp"
#include "bench/Peers.hpp"
#include "bench/Subjects.hpp"
#include "platform/linux/EventLoop.hpp"
#include "platform/linux/FileUserPreferences.hpp"
#include "platform/linux/LinuxFileSystem.hpp"

namespace bench {
namespace {

constexpr std::size_t changes = 200;
constexpr char key[] = "value";

// A switch counts as done when its announcement arrives: by then both stores and the alarm are durable.
Figure timeSwitches(const Device& device) {
  Client client(device.service()), watcher(device.hearthdService());
  watcher.call(
      callMessage(device.hearthdService(), "Watch", {std::string(pairwell::names::settingsChanged)}));
  return percentiles(times(changes, [&](std::size_t count) {
    client.call(callMessage(device.service(), "SetKestrelAudioAccessoryLimitedLogging", {count % 2 == 0}));
    while (watcher.receive(Client::Kind::signal) == 0) continue;
  }));
}

struct Observer : platform::KeyObserver {
  void observeValue(const std::optional<std::string>&, const void*) override { say(now()); }
};

// Says when its observer is called.
void observeStore(const std::string& path) {
  platform::linux_::EventLoop loop;
  platform::linux_::LinuxFileSystem files(&loop);
  const auto store = platform::linux_::FileUserPreferences::create(files, &loop, path);
  const auto observer = std::make_shared<Observer>();
  store->addObserver(observer, key);
  say(0);
  loop.run();
}

// Says when a file has got the name.
void watchFolder(const std::string& folder) {
  const int watch = ::inotify_init1(IN_CLOEXEC);
  ::inotify_add_watch(watch, folder.c_str(), IN_MOVED_TO);
  say(0);
  char events[4096];
  while (::read(watch, events, sizeof events) > 0) say(now());
}

void renameFile(const std::string& folder) {
  const std::string made = folder + "/new";
  std::ofstream(made) << "x";
  std::rename(made.c_str(), (folder + "/value").c_str());
}

template <class Change>
Figure timeChanges(Companion& listener, Change change) {
  std::vector<double> times;
  for (std::size_t count = 0; count < changes; ++count) {
    const double start = now();
    change();
    times.push_back(listener.moment() - start);
  }
  return percentiles(times);
}

}  // namespace

void measureSwitches(const std::string& programs) {
  Device device(programs);
  device.start();
  device.client();
  const std::string ours = "switch, durable and announced", bare = "bare calls of its four durable files";
  Table& switches = table("switches", "A switch", "µs");
  for (int round = 0; round < rounds; ++round) {
    // Root flag, cloud flag, end time, alarm.
    switches.add(bare, percentiles(bareDurableWrites(device.paths().var, changes, 4)));
    switches.add(ours, timeSwitches(device));
  }
  switches.compare(ours, "p50", bare, 1.3);
  switches.compare(ours, "p99", bare);
  switches.print();
}

namespace {

void measureChanges(const std::string& programs, Table& heard) {
  const fakes::TemporaryFolder stored, bare;
  Dconf dconf(programs, 1);
  const std::string path = stored.path + "/store.json", ours = "user preferences",
                    durable = "bare inotify, fsync, rename", peer = "dconf, not durable";
  Companion observer([&] { observeStore(path); });
  Companion watcher([&] { watchFolder(bare.path); });
  platform::linux_::LinuxFileSystem files{nullptr};
  const auto store = platform::linux_::FileUserPreferences::create(files, nullptr, path);
  std::int64_t value = 0;
  for (int round = 0; round < rounds; ++round) {
    heard.add(ours, timeChanges(observer, [&] { store->setValue(++value, key); }));
    heard.add("bare inotify, rename", timeChanges(watcher, [&] { renameFile(bare.path); }));
    heard.add(durable, timeChanges(watcher, [&] { bareDurableWrites(bare.path, 1, 1); }));
    std::vector<double> waits;
    for (std::size_t count = 0; count < changes; ++count) waits.push_back(dconf.write().heard);
    heard.add(peer, percentiles(waits));
  }
  heard.compare(ours, "p50", peer, 0.5);
  heard.compare(ours, "p50", durable);
  heard.compare(ours, "p99", peer);
  heard.print();
}

}  // namespace

// On the disk what lasts waits for it, and the peer's does not last; in memory all do the same.
void measureChanges(const std::string& programs) {
  const std::string title = "A change by another process until a store's observer hears of it";
  measureChanges(programs, table("changes", title, "µs"));
  const Variable folder("TMPDIR", "/dev/shm");
  measureChanges(programs, table("changes-memory", title + ", files in memory", "µs"));
}

}  // namespace bench
