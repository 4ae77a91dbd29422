// A whole device: its files, hearthd's alarms, pairwelld and cloudsyncd, each of which may die alone.
#pragma once

#include <cmath>
#include <optional>

#include "cloudsyncd/Synchroniser.hpp"
#include "hearthd/core/Alarms.hpp"
#include "platform/linux/CloudReplica.hpp"
#include "platform/linux/FileRadixController.hpp"
#include "platform/linux/FileUserPreferences.hpp"
#include "platform/linux/ReplicaFileCloudStore.hpp"
#include "platform/linux/SettingsDocument.hpp"
#include "tests/fakes/MemoryFileSystem.hpp"
#include "tests/pairwelld/World.hpp"
#include "tests/simulation/Network.hpp"

namespace simulation {

using pairwell::KeyValueSource;
using platform::Dictionary;
using platform::Time;
using platform::Value;
using platform::linux_::CloudEntry;

inline constexpr const char* replicaPath = "/var/cloud.json";
inline const std::string flagKey = pairwell::flagKey;
inline const std::string endKey = pairwell::endKey;

// What outlives the processes.
struct Machine {
  fakes::MemoryFileSystem files;
  hearth::Alarms alarms;
  Time offset{};  // of its clock
  bool isCut = false;

  // Of the replica, durable or not.
  std::string bytes() const { return files.exists(replicaPath) ? files.bytes(replicaPath) : ""; }
  Dictionary entries() const { return entriesIn(bytes()); }
  static Dictionary entriesIn(const std::string& bytes) {
    std::string problem;
    const auto document = platform::linux_::decodeSettings(bytes, problem);
    return document ? platform::linux_::settingsValues(*document) : Dictionary();
  }
};

struct SilentLog : platform::LogSink {
  bool enabled(const platform::LogChannel&, platform::LogLevel) override { return false; }
  void write(const platform::LogChannel&, platform::LogLevel, std::string_view,
             std::span<const platform::LogArgument>) override {}
};

// hearthd's alarms, as its link brings them to the one job.
class Streams : public platform::EventStreams {
 public:
  Streams(hearth::Alarms& alarms_, platform::Clock& clock_, const Time& steady_)
      : alarms(alarms_), clock(clock_), steady(steady_) {}
  ~Streams() override { alarms.jobEnded(job); }

  void setHandler(std::string_view stream, std::shared_ptr<platform::WorkQueue> queue_,
                  Handler handler_) override {
    if (stream != EventStreams::alarms) return;
    queue = std::move(queue_);
    handler = std::make_shared<Handler>(std::move(handler_));
    alarms.handlerInstalled(job, std::string(stream), moment());
  }
  void setEvent(std::string_view stream, std::string_view name,
                const std::optional<Dictionary>& descriptor) override {
    const hearth::EventKey key{job, std::string(stream), std::string(name)};
    descriptor ? alarms.set(key, *descriptor->at("Date").as<platform::Date>()) : alarms.clear(key);
  }
  void deliverDue() {
    for (const hearth::Alarm& alarm : alarms.takeDue(moment())) {
      queue->async([this, alarm, handler = handler] {
        if (!isCurrent(alarm)) return;
        lastDelivered = alarm.date;
        (*handler)({{std::string(nameKey), alarm.key.name}});
        alarms.taken(alarm.key, alarm.generation);
      });
    }
  }
  // Steady; a microsecond late, as the sum of two clocks is not exact.
  std::optional<Time> nextDue() const {
    const auto next = alarms.next(moment());
    const auto wall = next.wall
                          ? std::optional(std::max(steady, steady + (*next.wall - clock.now()) + Time(1e-6)))
                          : std::nullopt;
    return wall && next.steady ? std::min(*wall, *next.steady) : wall ? wall : next.steady;
  }
  std::optional<platform::Date> lastDelivered;

 private:
  bool isCurrent(const hearth::Alarm& alarm) const {
    for (const auto& each : alarms.list()) {
      if (each.key == alarm.key) return each.generation == alarm.generation;
    }
    return false;
  }
  hearth::Moment moment() const { return {clock.now(), steady}; }

  static inline const std::string job = "pairwelld";
  hearth::Alarms& alarms;
  platform::Clock& clock;
  const Time& steady;
  std::shared_ptr<platform::WorkQueue> queue;
  std::shared_ptr<Handler> handler;
};

// What a process stands on. Nothing is logged: a log is not what is looked at here.
class Process : public fakes::FakePlatform {
 public:
  platform::LogSink& logSink() override { return silent; }
  bool isIdle() { return pool->isEmpty() && loop.queue->isEmpty() && delivery->isEmpty(); }

 private:
  SilentLog silent;
};

// pairwelld's process.
class Pairwelld : public Process {
 public:
  Pairwelld(Machine& machine_, const Time& now, std::uint64_t seed)
      : machine(machine_), streams_(machine.alarms, manualClock, now) {
    const platform::PlatformScope scope(*this);
    pool->seed(seed);
    manualClock.time = now + machine.offset;
    user = platform::linux_::FileUserPreferences::create(machine.files, delivery.get(), "/var/user.json");
    kvs = pairwell::KeyValueStoreManager::create();
    kvs->activate();
    manager = pairwell::DebugManager::create(kvs);
    manager->activate();
  }
  ~Pairwelld() override {
    const platform::PlatformScope scope(*this);
    pairwell::dropSubscriptions(*kvs);
    pairwell::World::letGo(*manager);
    manager.reset();
    kvs.reset();
    teardown();
  }

  bool isOn() {
    const platform::PlatformScope scope(*this);
    return manager->audioAccessoryLimitedLoggingEnabled();
  }
  // A client's call.
  void say(bool enabled) {
    const platform::PlatformScope scope(*this);
    manager->setAudioAccessoryLimitedLoggingEnabled(enabled);
  }

  platform::EventStreams& eventStreams() override { return streams_; }
  std::shared_ptr<platform::UserPreferences> userPreferences() override { return user; }
  std::shared_ptr<platform::CloudStore> makeCloudStore(std::string_view, int) override {
    return platform::linux_::ReplicaFileCloudStore::create(machine.files, delivery.get(), centre, manualClock,
                                                           replicaPath);
  }
  platform::RadixController& radixController() override { return radix; }
  Streams& hearthd() { return streams_; }

 private:
  Machine& machine;
  Streams streams_;
  std::shared_ptr<platform::UserPreferences> user;
  platform::linux_::FileRadixController radix{machine.files, "/var/root.json"};
  std::shared_ptr<pairwell::KeyValueStoreManager> kvs;
  std::shared_ptr<pairwell::DebugManager> manager;
};

// cloudsyncd's process.
class Cloudsyncd {
 public:
  Cloudsyncd(Machine& machine, Network& network, std::string writer)
      : platform(std::make_unique<Process>()),
        link(network, machine.isCut),
        replica(platform::linux_::SettingsFile::create(machine.files, replicaPath)),
        synchroniser({machine.files, replicaPath, *replica, link, platform->manualClock,
                      [&network] {
                        return cloudsync::Steady(
                            std::chrono::duration_cast<cloudsync::Steady::duration>(network.now));
                      },
                      "home", std::move(writer)}) {
    replica->startWatching(*platform->delivery, [this](const Dictionary& before, const Dictionary& after) {
      synchroniser.replicaChanged(before, after);
    });
    synchroniser.start();
  }

  std::optional<Time> nextDue() const {
    const auto due = synchroniser.deadline();
    return due ? std::optional(std::chrono::duration_cast<Time>(due->time_since_epoch())) : std::nullopt;
  }
  const std::unique_ptr<Process> platform;
  Network::Link link;
  const std::shared_ptr<platform::linux_::SettingsFile> replica;
  cloudsync::Synchroniser synchroniser;
};

}  // namespace simulation
