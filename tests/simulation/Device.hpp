// A whole device: its files, hearthd's alarms, pairwelld and cloudsyncd, each of which may die alone.
#pragma once

#include <cmath>
#include <optional>

#include "cloudsyncd/Synchroniser.hpp"
#include "hearthd/core/Alarms.hpp"
#include "hearthd/core/Broker.hpp"
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

inline bool flagIn(const Dictionary& entries) {
  const auto entry = CloudEntry::find(entries, flagKey);
  return entry && entry->value && platform::toBool(*entry->value).value_or(false);
}
inline double endIn(const Dictionary& entries) {
  const auto entry = CloudEntry::find(entries, endKey);
  return entry && entry->value ? platform::toDouble(*entry->value).value_or(0) : 0;
}

// Sums of clocks are not exact: what is due is looked at this much later.
inline constexpr Time rounding{1e-6};

// What outlives the processes.
struct Machine {
  fakes::MemoryFileSystem files;
  hearth::Alarms alarms;
  hearth::Broker broker;
  Time offset{};  // of its clock
  bool isCut = false;

  // The replica's; one object as long as the file stays as it is.
  std::shared_ptr<const Dictionary> entries() {
    std::string bytes = files.exists(replicaPath) ? files.bytes(replicaPath) : "";
    if (decoded && bytes == decodedBytes) return decoded;
    std::string problem;
    const auto document = platform::linux_::decodeSettings(bytes, problem);
    decoded = std::make_shared<const Dictionary>(document ? platform::linux_::settingsValues(*document)
                                                          : Dictionary());
    decodedBytes = std::move(bytes);
    return decoded;
  }
  // Whether a process that is being killed is past its last operation; one more is counted.
  bool isDead() { return ++files.calls >= files.failFrom; }

 private:
  std::string decodedBytes;
  std::shared_ptr<const Dictionary> decoded;
};

// hearthd's alarms, as its link brings them to the one job.
class Streams : public platform::EventStreams {
 public:
  Streams(Machine& machine_, platform::Clock& clock_, const Time& steady_)
      : machine(machine_), clock(clock_), steady(steady_) {}
  ~Streams() override { machine.alarms.jobEnded(job); }

  void setHandler(std::string_view stream, std::shared_ptr<platform::WorkQueue> queue_,
                  Handler handler_) override {
    if (stream != EventStreams::alarms) return;
    queue = std::move(queue_);
    handler = std::make_shared<Handler>(std::move(handler_));
    machine.alarms.handlerInstalled(job, std::string(stream), moment());
  }
  void setEvent(std::string_view stream, std::string_view name,
                const std::optional<Dictionary>& descriptor) override {
    if (machine.isDead()) return;
    const hearth::EventKey key{job, std::string(stream), std::string(name)};
    descriptor ? machine.alarms.set(key, *descriptor->at("Date").as<platform::Date>())
               : machine.alarms.clear(key);
  }
  void deliverDue() {
    for (const hearth::Alarm& alarm : machine.alarms.takeDue(moment())) {
      queue->async([this, alarm, handler = handler] {
        if (!isCurrent(alarm)) return;
        delivered = alarm.date;
        (*handler)({{std::string(nameKey), alarm.key.name}});
        if (!machine.isDead()) machine.alarms.taken(alarm.key, alarm.generation);
      });
    }
  }
  // Steady.
  std::optional<Time> nextDue() const {
    const auto next = machine.alarms.next(moment());
    const auto wall = next.wall
                          ? std::optional(std::max(steady, steady + (*next.wall - clock.now()) + rounding))
                          : std::nullopt;
    return wall && next.steady ? std::min(*wall, *next.steady) : wall ? wall : next.steady;
  }
  std::optional<platform::Date> delivered;  // the last one

 private:
  bool isCurrent(const hearth::Alarm& alarm) const {
    for (const auto& each : machine.alarms.list()) {
      if (each.key == alarm.key) return each.generation == alarm.generation;
    }
    return false;
  }
  hearth::Moment moment() const { return {clock.now(), steady}; }

  static inline const std::string job = "pairwelld";
  Machine& machine;
  platform::Clock& clock;
  const Time& steady;
  std::shared_ptr<platform::WorkQueue> queue;
  std::shared_ptr<Handler> handler;
};

// hearthd's broker says whether the one job watches what is posted.
class Notifications : public fakes::FakeNamedNotifications {
 public:
  Notifications(hearth::Broker& broker_, fakes::FakePlatform& process)
      : FakeNamedNotifications(process.effects, process.loop.queue), broker(broker_) {}
  ~Notifications() override { broker.remove(job); }

  void post(std::string_view name) override {
    if (!broker.watchers(std::string(name)).empty()) postFromElsewhere(name);
  }
  std::uint32_t registerHandler(std::string_view name, std::int32_t& token,
                                std::shared_ptr<platform::WorkQueue> queue, Handler handler) override {
    static_cast<void>(broker.watch(job, std::string(name)));
    return FakeNamedNotifications::registerHandler(name, token, std::move(queue), std::move(handler));
  }

 private:
  static constexpr hearth::Broker::Watcher job = 1;
  hearth::Broker& broker;
};

// What a process stands on.
class Process : public fakes::FakePlatform {
 public:
  platform::LogSink& logSink() override { return silent; }
  bool isIdle() { return pool->isEmpty() && loop.queue->isEmpty() && delivery->isEmpty(); }

 private:
  fakes::SilentLog silent;
};

// pairwelld's process.
class Pairwelld : public Process {
 public:
  Pairwelld(Machine& machine_, const Time& now, std::uint64_t seed)
      : machine(machine_), streams(machine, manualClock, now) {
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
    notifications.registrations.clear();
    pairwell::dropSubscriptions(*kvs);
    pairwell::World::letGo(*manager);
    manager.reset();
    kvs.reset();
    teardown();
  }

  // What a client is told.
  bool isOn() {
    const platform::PlatformScope scope(*this);
    return manager->audioAccessoryLimitedLoggingEnabled();
  }
  // A client's call.
  void say(bool enabled) {
    const platform::PlatformScope scope(*this);
    manager->setAudioAccessoryLimitedLoggingEnabled(enabled);
  }

  // What it has come to so far, without asking.
  bool state() PW_NO_ANALYSIS { return manager->_audioAccessoryLimitedLoggingEnabled; }
  bool rootFlag() {
    const auto values = radix.readPrefKeys({flagKey});
    const Value* flag = values ? platform::find(*values, flagKey) : nullptr;
    return flag && platform::toBool(*flag).value_or(false);
  }

  Streams& eventStreams() override { return streams; }
  platform::NamedNotifications& namedNotifications() override { return notifications; }
  platform::NamedNotificationCentre* namedNotificationCentre() override { return &notifications; }
  std::shared_ptr<platform::UserPreferences> userPreferences() override { return user; }
  std::shared_ptr<platform::CloudStore> makeCloudStore(std::string_view, int) override {
    return platform::linux_::ReplicaFileCloudStore::create(machine.files, delivery.get(), centre, manualClock,
                                                           replicaPath);
  }
  platform::RadixController& radixController() override { return radix; }

 private:
  Machine& machine;
  Streams streams;
  Notifications notifications{machine.broker, *this};
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
        link(network, machine.isCut, *platform),
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

  // Something of what waits for it, if anything does.
  void work() { platform->isIdle() ? synchroniser.timePassed() : static_cast<void>(platform->runOne()); }
  std::optional<Time> nextDue() const {
    const auto due = synchroniser.deadline();
    return due ? std::optional(std::chrono::duration_cast<Time>(due->time_since_epoch()) + rounding)
               : std::nullopt;
  }
  const std::unique_ptr<Process> platform;
  Network::Link link;
  const std::shared_ptr<platform::linux_::SettingsFile> replica;
  cloudsync::Synchroniser synchroniser;
};

}  // namespace simulation
