#include "pairwelld/debug/DebugManager.hpp"

#include <cmath>
#include <limits>

#include "tests/pairwelld/World.hpp"

namespace pairwell {
namespace {

constexpr double infinity = std::numeric_limits<double>::infinity();

Calls steps(const std::string& flag, const std::string& end, const std::string& alarm) {
  return {"root flag=" + flag,
          "post bluetooth.prefsChanged",
          "cloud flag=" + flag,
          "post cloud.storeChanged",
          "post pairwell.prefsChanged",
          "cloud end=" + end,
          "post cloud.storeChanged",
          "post pairwell.prefsChanged",
          "alarm " + alarm,
          "post pairwell.settingsChanged"};
}
const Calls stopped = steps("false", "nil", "cleared"),
            fresh = steps("true", "1345600.0", "at 1345600000000000 ns");

class DebugManagerTest : public World {
 public:
  Calls effectsAfterRun() {
    run();
    auto all = effects(Effects::store | Effects::alarm | Effects::post);
    mark();
    return all;
  }
  Calls debugLines() const {
    Calls lines;
    for (const auto& line : log()) {
      const std::string prefix = "debugManager ";
      if (line.find(prefix) == 0 && line.find("keyValueChanged") == line.npos)
        lines.push_back(line.substr(prefix.size()));
    }
    return lines;
  }
  std::shared_ptr<DebugManager> makeIdle() {
    auto manager = makeDebugManager();
    run();
    mark();
    return manager;
  }
  // Running, with its end an hour from now.
  std::shared_ptr<DebugManager> makeRunning() {
    platform.cloud->store(flagKey, true);
    platform.cloud->store(endKey, now() + 3600);
    return makeIdle();
  }
  bool isOn(DebugManager& manager) { return manager.audioAccessoryLimitedLoggingEnabled(); }
  void set(DebugManager& manager, bool enabled) { manager.setAudioAccessoryLimitedLoggingEnabled(enabled); }
};

TEST_F(DebugManagerTest, StartAndStopTakeTheirStepsInOrder) {
  const auto manager = makeIdle();
  set(*manager, true);
  EXPECT_THAT(effects(~0u), IsEmpty()) << "it is only queued";
  run();
  EXPECT_THAT(debugLines(), ElementsAre("default: Start audio accessory limited logging",
                                        "info: Requesting default expiration interval"));
  EXPECT_THAT(log(), testing::Contains("debugManager default: keyValueChanged source: root"));
  EXPECT_EQ(effectsAfterRun(), fresh);
  EXPECT_TRUE(isOn(*manager));
  set(*manager, true);
  EXPECT_THAT(effectsAfterRun(), IsEmpty());
  set(*manager, false);
  run();
  EXPECT_THAT(debugLines(), ElementsAre("default: Stop Audio Accessory Limited Logging"));
  EXPECT_EQ(effectsAfterRun(), stopped);
  EXPECT_FALSE(isOn(*manager));
  set(*manager, false);
  run();
  EXPECT_THAT(effects(~0u), IsEmpty());
}

TEST_F(DebugManagerTest, AnOverrideGivesTheLengthOfANewPeriod) {
  const struct {
    const char* name;
    std::optional<Value> interval;
    const char* text;
    double length;
  } table[] = {
      {"absent", {}, "default", 345600},
      {"a minute", 60, "override 60.0", 60},
      {"fraction", 0.5, "override 0.5", 0.5},
      {"many digits", 100000, "override 100000.0", 100000},
      {"zero", 0, "default", 345600},
      {"negative", -60, "default", 345600},
      {"not a number", std::nan(""), "default", 345600},
      {"text", "60", "default", 345600},
  };
  const auto manager = makeIdle();
  for (const auto& row : table) {
    SCOPED_TRACE(row.name);
    platform.user->store(overrideKey, row.interval);
    set(*manager, true);
    run();
    EXPECT_THAT(debugLines(),
                testing::Contains("info: Requesting " + std::string(row.text) + " expiration interval"));
    EXPECT_EQ(platform.cloud->value(endKey), Value(now() + row.length));
    EXPECT_EQ(platform.streams.alarms.size(), 1u);
    EXPECT_EQ(platform.streams.nextDue(), platform::Time(std::trunc(now() + row.length)));
    set(*manager, false);
    run();
    mark();
  }
}

TEST_F(DebugManagerTest, AnEndWithoutAnAlarmDateGivesAPeriodWithoutAnAlarm) {
  const auto manager = makeIdle();
  for (double interval : {1e16, infinity}) {
    platform.user->store(overrideKey, interval);
    set(*manager, true);
    run();
    EXPECT_THAT(debugLines(), testing::Contains("info: Requesting override " + platform::describe(interval) +
                                                " expiration interval"));
    EXPECT_EQ(platform.cloud->value(endKey), Value(now() + interval));
    EXPECT_THAT(effects(Effects::alarm), IsEmpty());
    platform.advance(platform::Time(1e9));
    EXPECT_TRUE(isOn(*manager));
    set(*manager, false);
    EXPECT_EQ(effectsAfterRun().back(), stopped.back());
  }
}

// The clock stands at 1,000,000.
TEST_F(DebugManagerTest, AStoredEndFoundAtStartIsKeptPassedOrTakenForNone) {
  const Calls kept = steps("true", "1000100.75", "at 1000100000000000 ns"), nothing;
  const struct {
    const char* name;
    std::optional<Value> flag, end;
    Calls effects;
    bool on;
  } table[] = {
      {"flag absent", {}, 1000100.75, nothing, false},
      {"flag off", false, 1000100.75, nothing, false},
      {"future", true, 1000100.75, kept, true},
      {"absent", true, {}, fresh, true},
      {"past", true, 999999.5, stopped, false},
      {"this moment", true, 1000000, steps("true", "1000000.0", "at 1000000000000000 ns"), true},
      {"zero", true, 0, fresh, true},
      {"negative", true, -5, fresh, true},
      {"not a number", true, std::nan(""), fresh, true},
      {"infinite", true, infinity, fresh, true},
      {"out of range", true, 9223372037.0, fresh, true},
      {"text", true, "1000100", fresh, true},
  };
  for (const auto& row : table) {
    SCOPED_TRACE(row.name);
    DebugManagerTest device;
    device.platform.cloud->store(flagKey, row.flag);
    device.platform.cloud->store(endKey, row.end);
    const auto manager = device.makeDebugManager();
    EXPECT_EQ(device.effectsAfterRun(), row.effects);
    EXPECT_EQ(isOn(*manager), row.on);
  }
}

TEST_F(DebugManagerTest, AnEndThatHasPassedTurnsTheFirstOnIntoAStop) {
  const auto manager = makeIdle();
  platform.cloud->store(endKey, now() - 1);
  set(*manager, true);
  EXPECT_EQ(effectsAfterRun(), stopped);
  set(*manager, true);
  EXPECT_EQ(effectsAfterRun(), fresh);
}

TEST_F(DebugManagerTest, TheFirstReadAfterTheEndStopsThePeriod) {
  const auto manager = makeRunning();
  platform.manualClock.time += platform::Time(3600);
  EXPECT_TRUE(isOn(*manager));
  EXPECT_THAT(effectsAfterRun(), IsEmpty());
  platform.manualClock.time += platform::Time(0.001);
  EXPECT_FALSE(isOn(*manager));
  EXPECT_THAT(effects(~0u), ElementsAre("debugManager default: Audio accessory limited logging expired"));
  EXPECT_EQ(effectsAfterRun(), stopped);
  platform.cloud->store(endKey, now() - 1);
  EXPECT_FALSE(isOn(*manager));
  EXPECT_THAT(effects(~0u), IsEmpty()) << "what is off does not expire";
}

TEST_F(DebugManagerTest, OnlyItsOwnAlarmEndsThePeriod) {
  const auto manager = makeRunning();
  SystemNotificationManager::shared()->scheduleAlarm("velalogcloudcollectionenabled", now() + 60);
  mark();
  platform.advance(platform::Time(3599));
  EXPECT_TRUE(isOn(*manager));
  EXPECT_THAT(debugLines(), IsEmpty());
  EXPECT_THAT(effectsAfterRun(), IsEmpty());
  platform.advance(platform::Time(1));
  EXPECT_THAT(
      debugLines(),
      ElementsAre("default: didReceieve notification from source: alarm, name: VelaLogCloudCollectionEnabled",
                  "default: Stop Audio Accessory Limited Logging"));
  EXPECT_EQ(effectsAfterRun(), stopped);
  EXPECT_TRUE(platform.streams.alarms.empty());
}

TEST_F(DebugManagerTest, AnyChangeLeadsToTheCloudFlag) {
  const auto manager = makeRunning();
  const std::function<void()> changes[] = {
      [&] { platform.named.postFromElsewhere("com.kestrel.bluetooth.prefsChanged"); },
      [&] { platform.user->changeFromElsewhere(overrideKey, 1); },
      [&] {
        platform.cloud->changeFromElsewhere({{"other", 1}});
      },
  };
  bool flag = true;
  for (const auto& change : changes) {
    flag = !flag;
    platform.cloud->store(flagKey, flag);
    change();
    run();
    EXPECT_EQ(isOn(*manager), flag);
  }
  EXPECT_THAT(log(), testing::Contains("debugManager default: keyValueChanged source: user"));
}

TEST_F(DebugManagerTest, AFailedStoreHoldsUpNoStep) {
  const auto manager = makeIdle();
  platform.radix.failure = std::make_error_code(std::errc::io_error);
  set(*manager, true);
  run();
  EXPECT_TRUE(isOn(*manager));
  EXPECT_EQ(effects(Effects::post).back(), "post pairwell.settingsChanged");
  set(*manager, false);
  run();
  platform.cloud->failing = true;
  mark();
  set(*manager, true);
  run();
  EXPECT_FALSE(isOn(*manager)) << "the cloud still says off";
  EXPECT_THAT(effects(Effects::alarm), ElementsAre("alarm at 1345600000000000 ns", "alarm cleared"));
}

TEST_F(DebugManagerTest, ItsEndGivesBackTheSubscriptionAndLogsAnError) {
  for (const std::error_code result : {std::error_code(), std::make_error_code(std::errc::io_error)}) {
    auto manager = DebugManager::create(makeManager());
    // A handle that holds nobody, or the manager could not go.
    manager->kvsSubscription.emplace(nullptr, [&](const auto&) {
      calls.push_back("given back");
      return platform::Result<void>(result);
    });
    manager.reset();
    run();
  }
  EXPECT_THAT(calls, ElementsAre("given back", "given back"));
  EXPECT_THAT(log(),
              ElementsAre("debugManager error: DebugManager unable to unsubscribe: Input/output error"));
}

}  // namespace
}  // namespace pairwell
