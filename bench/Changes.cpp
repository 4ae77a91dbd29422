// Changes that must last: a switch until it is announced, and a value until another process has it.
#include <sys/inotify.h>
#include <unistd.h>

#include <cstdlib>
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

constexpr std::size_t changes = 100;
constexpr char key[] = "value";

// A switch counts as done when its announcement arrives: by then both stores and the alarm are durable.
std::vector<double> timeSwitches(const Device& device) {
  Client client(device.service()), watcher(device.hearthdService());
  watcher.call(
      callMessage(device.hearthdService(), "Watch", {std::string(pairwell::names::settingsChanged)}));
  std::vector<double> times;
  for (std::size_t count = 0; count < changes; ++count) {
    const auto call =
        callMessage(device.service(), "SetKestrelAudioAccessoryLimitedLogging", {count % 2 == 0});
    const double start = now();
    client.call(call);
    while (watcher.receive(Client::Kind::signal) == 0) continue;
    times.push_back(now() - start);
  }
  return times;
}

struct Observer : platform::KeyObserver {
  void observeValue(const std::optional<std::string>&, const void*) override { Companion::say(now()); }
};

// Says when its observer is called.
void observeStore(const std::string& path) {
  platform::linux_::EventLoop loop;
  platform::linux_::LinuxFileSystem files(&loop);
  const auto store = platform::linux_::FileUserPreferences::create(files, &loop, path);
  const auto observer = std::make_shared<Observer>();
  store->addObserver(observer, key);
  Companion::say(0);
  loop.run();
}

// Says when a file has got the name.
void watchFolder(const std::string& folder) {
  const int watch = ::inotify_init1(IN_CLOEXEC);
  ::inotify_add_watch(watch, folder.c_str(), IN_MOVED_TO);
  Companion::say(0);
  char events[4096];
  while (::read(watch, events, sizeof events) > 0) Companion::say(now());
}

template <class Change>
std::vector<double> timeChanges(Companion& listener, Change change) {
  std::vector<double> times;
  for (std::size_t count = 0; count < changes; ++count) {
    const double start = change(count);
    times.push_back(listener.moment() - start);
  }
  return times;
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
    switches.add(ours, percentiles(timeSwitches(device)));
  }
  switches.compare(ours, "p50", bare, 1.3);
  switches.compare(ours, "p99", bare);
  switches.print();
}

namespace {

void measureChanges(const std::string& programs, Table& heard) {
  const fakes::TemporaryFolder stored, bare, settings;
  ::setenv("XDG_CONFIG_HOME", settings.path.c_str(), 1);
  ::setenv("XDG_RUNTIME_DIR", settings.path.c_str(), 1);
  const Bus bus(Bus::Kind::daemon, programs);
  ::setenv("DBUS_SESSION_BUS_ADDRESS", bus.address().c_str(), 1);
  Companion dconfListener({programs + "/pairwell_dconf", "watch"});
  Companion dconfWriter({programs + "/pairwell_dconf", "write", "1"});
  const std::string path = stored.path + "/store.json";
  Companion observer([&] { observeStore(path); });
  Companion watcher([&] { watchFolder(bare.path); });
  platform::linux_::LinuxFileSystem files{nullptr};
  const auto store = platform::linux_::FileUserPreferences::create(files, nullptr, path);
  const std::string ours = "a store's observer", dconf = "dconf";
  for (int round = 0; round < rounds; ++round) {
    heard.add(ours, percentiles(timeChanges(observer, [&](std::size_t count) {
                const double start = now();
                store->setValue(static_cast<std::int64_t>(count) + round * 1000, key);
                return start;
              })));
    heard.add("bare inotify, not durable", percentiles(timeChanges(watcher, [&](std::size_t) {
                std::ofstream(bare.path + "/new") << "x";
                const double start = now();
                std::rename((bare.path + "/new").c_str(), (bare.path + "/value").c_str());
                return start;
              })));
    heard.add("bare inotify behind a durable write", percentiles(timeChanges(watcher, [&](std::size_t) {
                const double start = now();
                bareDurableWrites(bare.path, 1, 1);
                return start;
              })));
    heard.add(dconf, percentiles(timeChanges(dconfListener, [&](std::size_t) {
                dconfWriter.goOn();
                const double start = dconfWriter.moment();
                dconfWriter.moment();
                return start;
              })));
  }
  heard.compare(ours, "p50", dconf, 0.5);
  heard.compare(ours, "p99", dconf);
  heard.print();
}

}  // namespace

// On the disk what lasts waits for it, and the peer's does not last; in memory all do the same.
void measureChanges(const std::string& programs) {
  const std::string title = "A change by another process until the subscriber hears";
  measureChanges(programs, table("changes", title, "µs"));
  ::setenv("TMPDIR", "/dev/shm", 1);
  measureChanges(programs, table("changes-memory", title + ", files in memory", "µs"));
  ::unsetenv("TMPDIR");
}

}  // namespace bench
