// A device cut short between any two effects of a switch: what is left, and that it can be used again.
#include <cmath>

#include "platform/linux/FileRadixController.hpp"
#include "platform/linux/FileUserPreferences.hpp"
#include "platform/linux/ReplicaFileCloudStore.hpp"
#include "tests/fakes/MemoryFileSystem.hpp"
#include "tests/pairwelld/World.hpp"

namespace pairwell {
namespace {

using Defaults = KeyValueStoreManager::Defaults;

// What outlives a process: the files, the clock, and hearthd with its alarms. All operations count together.
struct Machine {
  fakes::MemoryFileSystem files;
  std::map<fakes::FakeEventStreams::Key, fakes::FakeEventStreams::Alarm> alarms;
  platform::Time now{1'000'000};
};

// One run of the daemon's process, on the machine's files.
class Process : public fakes::FakePlatform {
 public:
  explicit Process(Machine& machine_) : machine(machine_), scope(*this) {
    manualClock.time = machine.now;
    streams.isCut = [this] { return ++machine.files.calls >= machine.files.failFrom; };
    streams.alarms = machine.alarms;
    for (auto& [key, alarm] : streams.alarms) alarm.sent = false;
    kvs = KeyValueStoreManager::create();
    kvs->activate();
    manager = DebugManager::create(kvs);
    manager->activate();
    settle();
  }
  ~Process() override {
    machine.now = manualClock.time;
    machine.alarms = streams.alarms;
    dropSubscriptions(*kvs);
    World::letGo(*manager);
    manager.reset();
    kvs.reset();
    teardown();
  }

  void say(bool enabled) {
    manager->setAudioAccessoryLimitedLoggingEnabled(enabled);
    settle();
  }
  bool isOn() { return manager->audioAccessoryLimitedLoggingEnabled(); }
  bool flag(KeyValueSource source) { return kvs->getBool(source, Defaults::velaLogCloudCollectionEnabled); }
  double end() {
    return kvs->getDouble(KeyValueSource::cloud, Defaults::velaLogCloudCollectionEnabledExpiration);
  }
  bool isClean() {
    return !isOn() && !flag(KeyValueSource::root) && !flag(KeyValueSource::cloud) && end() == 0 &&
           streams.alarms.empty();
  }
  // On, and everything says so.
  bool isWholly() {
    return isOn() && flag(KeyValueSource::root) && flag(KeyValueSource::cloud) && end() > 0 &&
           streams.alarms.size() == 1 &&
           streams.alarms.begin()->second.due() == platform::Time(std::floor(end()));
  }

  std::shared_ptr<platform::UserPreferences> userPreferences() override { return user; }
  std::shared_ptr<platform::CloudStore> makeCloudStore(std::string_view, int) override {
    return platform::linux_::ReplicaFileCloudStore::create(machine.files, delivery.get(), centre, manualClock,
                                                           "/var/cloud.json");
  }
  platform::RadixController& radixController() override { return radix; }

 private:
  void settle() {
    runAll();
    machine.files.deliverEvents();
    runAll();
  }

  Machine& machine;
  const platform::PlatformScope scope;
  const std::shared_ptr<platform::UserPreferences> user =
      platform::linux_::FileUserPreferences::create(machine.files, delivery.get(), "/var/user.json");
  platform::linux_::FileRadixController radix{machine.files, "/var/root.json"};
  std::shared_ptr<KeyValueStoreManager> kvs;
  std::shared_ptr<DebugManager> manager;
};

// The switch to `enabled` from its opposite, with the Nth operation and all after it failing; whether it was
// cut.
bool cutSwitch(Machine& machine, bool enabled, int operation) {
  Process process(machine);
  if (!enabled) process.say(true);
  machine.files.failFrom = machine.files.calls + operation;
  process.say(enabled);
  return machine.files.calls >= machine.files.failFrom;
}

void checkAfterwards(Machine& machine) {
  {
    Process process(machine);
    EXPECT_EQ(process.isOn(), process.flag(KeyValueSource::cloud));
    // Off may leave the root flag, an end time or an alarm behind; on is whole.
    EXPECT_EQ(process.isOn(), process.isWholly());
    process.advance(platform::Time(345602));
    EXPECT_FALSE(process.isOn());
    EXPECT_FALSE(process.flag(KeyValueSource::cloud));
    EXPECT_TRUE(process.streams.alarms.empty());
  }
  Process process(machine);
  const bool endLeft = process.end() > 0;
  process.say(true);
  if (endLeft) {
    EXPECT_TRUE(process.isClean()) << "an end that has passed is cleared first";
    process.say(true);
  }
  EXPECT_TRUE(process.isWholly());
  process.say(false);
  EXPECT_TRUE(process.isClean());
}

TEST(CutTest, LeavesOnlyKnownResiduesAndADeviceThatWorks) {
  for (const bool enabled : {true, false}) {
    for (const bool power : {false, true}) {
      int cuts = 0;
      for (bool cut = true; cut && !testing::Test::HasFailure(); cuts += cut) {
        SCOPED_TRACE(std::string(enabled ? "on" : "off") + (power ? ", power cut" : "") + " at operation " +
                     std::to_string(cuts + 1));
        Machine machine;
        cut = cutSwitch(machine, enabled, cuts + 1);
        machine.files.failFrom = std::numeric_limits<int>::max();
        if (power) machine.files.powerCut();
        checkAfterwards(machine);
      }
      EXPECT_GT(cuts, 30) << "operations of a switch";
    }
  }
}

}  // namespace
}  // namespace pairwell
