#include "pairwelld/PairwellDaemon.hpp"

#include "tests/pairwelld/World.hpp"

namespace pairwell {
namespace {

const std::string bootSession = "01234567-89AB-CDEF-0123-456789ABCDEF";

struct PairwellDaemonTest : World {
  // The whole program, until its loop has nothing left to do.
  void launch() {
    platform.cutSubscriptions.push_back([] {
      const auto running = std::dynamic_pointer_cast<PairwellDaemon>(daemon());
      if (!running) return;
      dropSubscriptions(*running->keyValueStoreManager);
      letGo(*running->debugManager());
      daemon().reset();
    });
    EXPECT_EQ(runPairwellDaemon(), 0);
  }
  static std::string textOfStop(const std::function<void()>& work) {
    try {
      work();
    } catch (const fakes::Stopped& stopped) {
      return stopped.text;
    }
    return "no stop";
  }
};

TEST_F(PairwellDaemonTest, LaunchesInOrderAndActivatesEverything) {
  launch();
  run();
  EXPECT_THAT(
      effects(Effects::log | Effects::store),
      ElementsAre(
          "daemon default: Launching pairwelld (com.kestrel.pairwell.conduit)",
          "user LastOSLaunchVersion=21A5248v", "daemon default: No lastLaunchBootSessionUUID on record",
          "daemon default: This is the first run since reboot",
          "user lastLaunchBootSessionUUID=" + bootSession, "daemon default: First launch since boot...",
          "daemon default: Activate pairwelld services", "daemon default: Activate KeyValueStoreManager",
          "daemon default: Start KeyValueStoreCustomObserver", "kvs default: Cloud KVS synchronized: true",
          "kvs default: Cloud KVS snapshot: [:]", "debugManager default: Activate Debug Manager",
          "conduit default: Activate Pairwell Controller Conduit Service"));
  EXPECT_THAT(platform.cloudStoresMade, ElementsAre("com.kestrel.bluetooth.cloud.settings 2"));
  EXPECT_EQ(platform.streams.handlers.size(), 2u);
  ASSERT_EQ(platform.listeners.size(), 1u);
  EXPECT_TRUE(platform.listeners[0]->resumed);
  const auto running = std::dynamic_pointer_cast<PairwellDaemon>(daemon());
  ASSERT_TRUE(running);
  EXPECT_EQ(running->conduitListener()->debugManager, running->debugManager());
}

struct LockableInfo : SystemInfo {
  bool deviceFirstUnlocked() const override { return unlocked; }
  bool unlocked = false;
};

TEST_F(PairwellDaemonTest, WaitsForTheFirstUnlockAndActivatesOnce) {
  const std::string line = "daemon default: ", before = line + "pairwelld is before first unlock",
                    unlocked = line + "Device first unlocked notification";
  const auto post = [this] {
    platform.named.postFromElsewhere("com.kestrel.mobile.lockvaultd.lock_status");
    run();
  };
  const auto info = std::make_shared<LockableInfo>();
  auto waiting = std::make_shared<PairwellDaemon>();
  waiting->setSystemInfo(info);
  EXPECT_EQ(waiting->lockVaultToken, 0);
  waiting->activate();
  EXPECT_EQ(waiting->lockVaultToken, 1);
  post();
  EXPECT_EQ(waiting->lockVaultToken, 2);
  EXPECT_THAT(log(), ElementsAre(before, unlocked, before));
  EXPECT_EQ(platform.named.registrations.size(), 1u);
  mark();
  info->unlocked = true;
  post();
  post();
  EXPECT_EQ(waiting->lockVaultToken, -1);
  EXPECT_THAT(platform.named.cancelled, ElementsAre(1, 2));
  EXPECT_EQ(log()[0], unlocked);
  EXPECT_THAT(log(), testing::Contains(line + "Activate pairwelld services").Times(1));
  dropSubscriptions(*waiting->keyValueStoreManager);
  letGo(*waiting->debugManager());
}

struct HistoryDaemon : Daemon {
  void start() override {}
  void migrate(const SystemVersionNumber& from, const SystemVersionNumber& to) override {
    calls += from.rawValue + " to " + to.rawValue + ";";
  }
  void firstLaunchSinceBoot() override { calls += "first launch;"; }
  std::string calls;
};

TEST_F(PairwellDaemonTest, LaunchHistoryTellsUpdatesAndBootsApart) {
  const Calls noLines, same = {"daemon default: This is *NOT* the first run since reboot"},
                       reboot = {"daemon default: This is the first run since reboot"},
                       unrecorded = {"daemon default: No lastLaunchBootSessionUUID on record", reboot[0]};
  constexpr const char *none = nullptr, *older = "11234567-89AB-CDEF-0123-456789ABCDEF";
  const char* const now = bootSession.c_str();
  constexpr const char* lower = "01234567-89ab-cdef-0123-456789abcdef";
  const struct {
    const char *name, *storedVersion, *storedSession, *testLast, *testCurrent, *build, *calls;
    const char *versionAfter, *sessionAfter;
    const Calls& lines;
  } table[] = {
      {"empty store", none, none, none, none, "20A362", "first launch;", "20A362", now, unrecorded},
      {"nothing new", "20A362", now, none, none, "20A362", "", "20A362", now, same},
      {"session in lower case", "20A362", lower, none, none, "20A362", "", "20A362", lower, same},
      {"reboot", "20A362", older, none, none, "20A362", "first launch;", "20A362", now, reboot},
      {"update and reboot", "20A362", older, none, none, "21A1", "20A362 to 21A1;first launch;", "21A1", now,
       reboot},
      {"session that is none", "20A1", "yesterday", none, none, "20A1", "first launch;", "20A1", now,
       unrecorded},
      {"stored version that is none", "x", now, none, none, "20A362", "", "20A362", now, same},
      {"build whose print differs", "19A57", now, none, none, "19A5007", "19A57 to 19A5007;", "19A57", now,
       same},
      {"build that does not parse", "20A362", none, none, none, "Debian", "", "20A362", none, noLines},
      {"both overrides", "20A3", none, "20A1", "20A2", "20A3", "20A1 to 20A2;first launch;", "20A3", now,
       unrecorded},
      {"current alone", "20A362", now, none, "20A2", "Debian", "", "20A362", now, same},
  };
  const auto value = [](const char* text) { return text ? std::optional<Value>(text) : std::nullopt; };
  const auto parsed = [](const char* text) {
    return text ? SystemVersionNumber::fromString(text) : std::nullopt;
  };
  for (const auto& row : table) {
    SCOPED_TRACE(row.name);
    platform.user->store("LastOSLaunchVersion", value(row.storedVersion));
    platform.user->store("lastLaunchBootSessionUUID", value(row.storedSession));
    platform.device.answers["BuildVersion"] = row.build;
    mark();
    HistoryDaemon history;
    history.recordLaunch(parsed(row.testLast), parsed(row.testCurrent));
    EXPECT_EQ(history.calls, row.calls);
    EXPECT_EQ(log(), row.lines);
    EXPECT_EQ(platform.user->value("LastOSLaunchVersion"), value(row.versionAfter));
    EXPECT_EQ(platform.user->value("lastLaunchBootSessionUUID"), value(row.sessionAfter));
  }
}

TEST_F(PairwellDaemonTest, LaunchHistoryStopsTheProcessWhereItCannotGoOn) {
  HistoryDaemon history;
  EXPECT_EQ(textOfStop([&] { history.recordLaunch("20A1"_osVersion, {}); }), "No testCurrentversion!");
  EXPECT_THAT(log(), IsEmpty());
  for (const char* session : {"", "not a UUID", "01234567-89AB-CDEF-0123-456789ABCDE\xe9"}) {
    platform.kernel.bootSession = session;
    EXPECT_EQ(textOfStop([&] { history.recordLaunch({}, {}); }), "Unable to get kern.bootsessionuuid!");
    EXPECT_THAT(log(), IsEmpty());
  }
  platform.kernel.failure = ENOENT;
  EXPECT_EQ(textOfStop([&] { history.recordLaunch({}, {}); }), "Unable to get kern.bootsessionuuid!");
  EXPECT_THAT(log(), ElementsAre("daemon error: Error from sysctlbyname: No such file or directory(2"));
}

TEST_F(PairwellDaemonTest, SystemInfoTakesOnlyTheRightTypeAndLogsErrors) {
  const SystemInfo info;
  platform.device.answers = {
      {"ProductType", "c"}, {"ProductVersion", 15}, {"UniqueChipID", 7.0}, {"ChipID", "8"}};
  platform.device.errors = {{"ProductType", -5}, {"BuildVersion", 3}};
  EXPECT_EQ(info.productType() + info.osVersion() + info.buildVersion(), "c");
  EXPECT_EQ(info.ecid(), 7);
  EXPECT_EQ(info.chipID(), std::nullopt);
  EXPECT_THAT(log(),
              ElementsAre("daemon error: SextantCopyAnswerWithError error for key: ProductType -> -5"));
}

TEST_F(PairwellDaemonTest, MigrationHookNamesItsDirection) {
  PairwellDaemon hooks;
  hooks.migrate("20A362"_osVersion, "21A5248v"_osVersion);
  hooks.migrate("21A5248v"_osVersion, "20A362"_osVersion);
  hooks.migrate("21A5248"_osVersion, "21A6248"_osVersion);
  EXPECT_THAT(log(), ElementsAre("daemon default: Migrating from 20A362 to 21A5248v",
                                 "daemon default: Back-migrating from 21A5248v to 20A362",
                                 "daemon default: Back-migrating from 21A5248 to 21A6248"));
}

}  // namespace
}  // namespace pairwell
