#include "pairwelld/debug/DebugManager.hpp"

#include <cmath>

#include "tests/pairwelld/World.hpp"

namespace pairwell {
namespace {

Calls steps(std::string flag, std::string end, std::string alarm) {
  const std::string cloud = "post cloud.storeChanged", changed = "post pairwell.prefsChanged";
  Calls all = {"root flag=" + flag, "post bluetooth.prefsChanged", "cloud flag=" + flag, cloud, changed};
  all.insert(all.end(), {"cloud end=" + end, cloud, changed, "alarm " + alarm});
  all.push_back("post pairwell.settingsChanged");
  return all;
}
// The clock stands at 1,000,000.
const Calls fresh = steps("true", "1345600.0", "at 1345600000000000 ns"),
            stopped = steps("false", "nil", "cleared"), nothing;

struct DebugManagerTest : World {
  void start() {
    manager = makeDebugManager();
    effectsAfterRun();
  }
  // With its end an hour from now.
  void startWithAPeriod() {
    platform.cloud->store(flagKey, true);
    platform.cloud->store(endKey, now() + 3600);
    start();
  }
  Calls effectsAfterRun() {
    run();
    lines.clear();
    for (const auto& line : log()) {
      if (line.find("debugManager ") == 0 && line.find("keyValueChanged") == line.npos)
        lines.push_back(line.substr(13));
    }
    const Calls all = effects(Effects::store | Effects::alarm | Effects::post);
    mark();
    return all;
  }
  Calls effectsOf(bool enabled) {
    manager->setAudioAccessoryLimitedLoggingEnabled(enabled);
    return effectsAfterRun();
  }
  bool isOn() { return manager->audioAccessoryLimitedLoggingEnabled(); }

  std::shared_ptr<DebugManager> manager;
  Calls lines;  // the manager's own, of the last run, but those that tell of changes
};

TEST_F(DebugManagerTest, StartAndStopTakeTheirStepsInOrder) {
  start();
  manager->setAudioAccessoryLimitedLoggingEnabled(true);
  EXPECT_THAT(effects(~0u), IsEmpty()) << "it is only queued";
  EXPECT_EQ(effectsAfterRun(), fresh);
  EXPECT_THAT(lines, ElementsAre("default: Start audio accessory limited logging",
                                 "info: Requesting default expiration interval"));
  EXPECT_TRUE(isOn());
  EXPECT_EQ(effectsOf(true), nothing);
  EXPECT_EQ(effectsOf(false), stopped);
  EXPECT_THAT(lines, ElementsAre("default: Stop Audio Accessory Limited Logging"));
  EXPECT_FALSE(isOn());
  EXPECT_EQ(effectsOf(false), nothing);
  EXPECT_THAT(lines, IsEmpty());
}

TEST_F(DebugManagerTest, AnOverrideGivesTheLengthOfANewPeriod) {
  const struct {
    const char* name;
    std::optional<Value> interval;
    const char* text;
    double length;
    bool alarm = true;
  } table[] = {
      {"fraction", 0.5, "override 0.5", 0.5},
      {"negative", -60, "default", 345600},
      {"not a number", std::nan(""), "default", 345600},
      {"past the last alarm", 1e16, "override 1e+16", 1e16, false},
  };
  start();
  for (const auto& row : table) {
    SCOPED_TRACE(row.name);
    platform.user->store(overrideKey, row.interval);
    effectsOf(true);
    EXPECT_EQ(lines.back(), "info: Requesting " + std::string(row.text) + " expiration interval");
    EXPECT_EQ(platform.cloud->value(endKey), Value(now() + row.length));
    const platform::Time due(std::trunc(now() + row.length));
    EXPECT_EQ(platform.streams.nextDue(), row.alarm ? std::optional(due) : std::nullopt);
    if (!row.alarm) platform.advance(platform::Time(1e9));
    EXPECT_TRUE(isOn());
    effectsOf(false);
  }
}

TEST_F(DebugManagerTest, AStoredEndFoundAtStartIsKeptPassedOrTakenForNone) {
  const Calls kept = steps("true", "1000100.75", "at 1000100000000000 ns");
  const struct {
    const char* name;
    std::optional<Value> flag, end;
    Calls effects;
  } table[] = {
      {"flag off", false, 1000100.75, nothing},
      {"future", true, 1000100.75, kept},
      {"absent", true, {}, fresh},
      {"past", true, 999999.5, stopped},
      {"this moment", true, 1000000, steps("true", "1000000.0", "at 1000000000000000 ns")},
      {"not a number", true, std::nan(""), fresh},
      {"out of range", true, 9223372037.0, fresh},
  };
  for (const auto& row : table) {
    SCOPED_TRACE(row.name);
    DebugManagerTest device;
    device.platform.cloud->store(flagKey, row.flag);
    device.platform.cloud->store(endKey, row.end);
    device.manager = device.makeDebugManager();
    EXPECT_EQ(device.effectsAfterRun(), row.effects);
    EXPECT_EQ(device.isOn(), row.effects.size() > 1 && row.effects != stopped);
  }
}

TEST_F(DebugManagerTest, TheFirstReadAfterTheEndStopsThePeriod) {
  startWithAPeriod();
  platform.manualClock.time += platform::Time(3600);
  EXPECT_TRUE(isOn());
  EXPECT_EQ(effectsAfterRun(), nothing);
  platform.manualClock.time += platform::Time(0.001);
  EXPECT_FALSE(isOn());
  EXPECT_THAT(effects(~0u), ElementsAre("debugManager default: Audio accessory limited logging expired"));
  EXPECT_EQ(effectsAfterRun(), stopped);
  platform.cloud->store(endKey, now() - 1);
  EXPECT_FALSE(isOn());
  EXPECT_THAT(effects(~0u), IsEmpty()) << "what is off does not expire";
  EXPECT_EQ(effectsOf(true), stopped) << "an end that has passed turns the first switch into a stop";
  EXPECT_EQ(effectsOf(true).front(), fresh.front());
}

TEST_F(DebugManagerTest, OnlyItsOwnAlarmEndsThePeriod) {
  startWithAPeriod();
  SystemNotificationManager::shared()->scheduleAlarm("velalogcloudcollectionenabled", now() + 60);
  mark();
  platform.advance(platform::Time(3599));
  EXPECT_EQ(effectsAfterRun(), nothing);
  EXPECT_THAT(lines, IsEmpty());
  EXPECT_TRUE(isOn());
  platform.advance(platform::Time(1));
  EXPECT_EQ(effectsAfterRun(), stopped);
  EXPECT_THAT(lines, ElementsAre("default: didReceieve notification from source: alarm, name: " +
                                     std::string(flagKey),
                                 "default: Stop Audio Accessory Limited Logging"));
  EXPECT_TRUE(platform.streams.alarms.empty());
}

TEST_F(DebugManagerTest, AnyChangeLeadsToTheCloudFlag) {
  startWithAPeriod();
  bool flag = true;
  for (const auto change : {&World::changeRoot, &World::changeUser, &World::changeCloud}) {
    flag = !flag;
    platform.cloud->store(flagKey, flag);
    (this->*change)();
    run();
    EXPECT_EQ(isOn(), flag);
  }
  EXPECT_THAT(log(), testing::Contains("debugManager default: keyValueChanged source: user"));
}

TEST_F(DebugManagerTest, ItsEndGivesBackTheSubscriptionAndLogsAnError) {
  manager = DebugManager::create(makeManager());
  // A handle that holds nobody, or the manager could not go.
  manager->kvsSubscription.emplace(nullptr,
                                   [](const auto&) { return std::make_error_code(std::errc::io_error); });
  manager.reset();
  run();
  EXPECT_THAT(log(),
              ElementsAre("debugManager error: DebugManager unable to unsubscribe: Input/output error"));
}

}  // namespace
}  // namespace pairwell
