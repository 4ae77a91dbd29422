#include "pairwelld/PairwellDaemon.hpp"

#include "tests/pairwelld/World.hpp"

namespace pairwell {
namespace {

const std::string bootSession = "01234567-89AB-CDEF-0123-456789ABCDEF";

struct PairwellDaemonTest : World {
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
  EXPECT_EQ(runPairwellDaemon(), 0);
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
  EXPECT_EQ(platform.streams.handlers.size(), 2u);
  ASSERT_EQ(platform.listeners.size(), 1u);
  EXPECT_TRUE(platform.listeners[0]->resumed);
  const auto running = std::dynamic_pointer_cast<PairwellDaemon>(daemon());
  ASSERT_TRUE(running);
  EXPECT_EQ(running->conduitListener()->debugManager, running->debugManager());
  dropSubscriptions(*running->keyValueStoreManager);
  letGo(*running->debugManager());
  daemon().reset();
}

struct LockableInfo : SystemInfo {
  bool deviceFirstUnlocked() const override { return unlocked; }
  bool unlocked = false;
};

TEST_F(PairwellDaemonTest, WaitsForTheFirstUnlockAndActivatesOnce) {
  const std::string before = "daemon default: pairwelld is before first unlock",
                    unlocked = "daemon default: Device first unlocked notification";
  const auto post = [this] {
    platform.named.postFromElsewhere("com.kestrel.mobile.lockvaultd.lock_status");
    run();
  };
  const auto info = std::make_shared<LockableInfo>();
  const auto waiting = std::make_shared<PairwellDaemon>();
  waiting->setSystemInfo(info);
  waiting->activate();
  post();
  EXPECT_THAT(log(), ElementsAre(before, unlocked, before));
  EXPECT_EQ(platform.named.registrations.size(), 1u);
  mark();
  info->unlocked = true;
  post();
  post();
  EXPECT_EQ(waiting->lockVaultToken, -1);
  EXPECT_THAT(platform.named.cancelled, ElementsAre(1, 2));
  EXPECT_EQ(log()[0], unlocked);
  EXPECT_THAT(log(), testing::Contains("daemon default: Activate pairwelld services").Times(1));
  dropSubscriptions(*waiting->keyValueStoreManager);
  letGo(*waiting->debugManager());
}

TEST_F(PairwellDaemonTest, LaunchHistoryTellsUpdatesAndBootsApart) {
  const std::string none = "No lastLaunchBootSessionUUID on record", launch = "First launch since boot...",
                    same = "This is *NOT* the first run since reboot",
                    reboot = "This is the first run since reboot";
  const std::string older = "11234567-89AB-CDEF-0123-456789ABCDEF";
  const struct {
    const char* name;
    std::optional<Value> storedVersion, storedSession;
    const char* build;
    Calls lines;
    std::optional<Value> versionAfter;
  } table[] = {
      {"empty store", {}, {}, "20A362", {none, reboot, launch}, "20A362"},
      {"nothing new", "20A362", bootSession, "20A362", {same}, "20A362"},
      {"update and reboot", "20A2", older, "21A1", {"Migrating from 20A2 to 21A1", reboot, launch}, "21A1"},
      {"back", "21A1", bootSession, "20A2", {"Back-migrating from 21A1 to 20A2", same}, "20A2"},
      {"session that is none", "20A1", "yesterday", "20A1", {none, reboot, launch}, "20A1"},
      {"stored version that is none", "x", bootSession, "20A362", {same}, "20A362"},
      {"print that differs",
       "19A57",
       bootSession,
       "19A5007",
       {"Back-migrating from 19A57 to 19A5007", same},
       "19A57"},
      {"build that does not parse", "20A362", {}, "Debian", {}, "20A362"},
  };
  PairwellDaemon history;
  const auto linesOf = [&](const auto&... versions) {
    mark();
    history.recordLaunch(versions...);
    Calls lines;
    for (const auto& line : log()) lines.push_back(line.substr(std::string("daemon default: ").size()));
    return lines;
  };
  for (const auto& row : table) {
    SCOPED_TRACE(row.name);
    platform.user->store("LastOSLaunchVersion", row.storedVersion);
    platform.user->store("lastLaunchBootSessionUUID", row.storedSession);
    platform.device.answers["BuildVersion"] = row.build;
    EXPECT_EQ(linesOf(std::nullopt, std::nullopt), row.lines);
    EXPECT_EQ(platform.user->value("LastOSLaunchVersion"), row.versionAfter);
    EXPECT_EQ(platform.user->value("lastLaunchBootSessionUUID"),
              row.lines.empty() ? row.storedSession : bootSession);
  }
  platform.user->store("lastLaunchBootSessionUUID", bootSession);
  EXPECT_THAT(linesOf("20A1"_osVersion, "20A2"_osVersion), ElementsAre("Migrating from 20A1 to 20A2", same));
  EXPECT_EQ(platform.user->value("LastOSLaunchVersion"), Value("20A362")) << "a test's versions are not kept";
}

TEST_F(PairwellDaemonTest, LaunchHistoryStopsTheProcessWhereItCannotGoOn) {
  PairwellDaemon history;
  EXPECT_EQ(textOfStop([&] { history.recordLaunch("20A1"_osVersion, {}); }), "No testCurrentversion!");
  EXPECT_THAT(log(), IsEmpty());
  for (const char* session : {"not a UUID", "01234567-89AB-CDEF-0123-456789ABCDE\xe9"}) {
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

}  // namespace
}  // namespace pairwell
