// The daemon, the service manager and the command lines together.
#include <random>
#include <thread>

#include "platform/linux/Paths.hpp"
#include "tests/system/Device.hpp"

namespace processes {
namespace {

struct SystemTest : Device {
  SystemTest() { EXPECT_EQ(run("hearthctl init --internal").status, 0); }

  // Returns once the client service answers.
  void start() {
    Device::start();
    ASSERT_EQ(run("pairwellctl status").status, 0) << log();
  }
  std::string setting(const std::string& source, const std::string& key) {
    const std::string line = run("hearthctl settings get " + source + " " + key).output;
    return line.substr(0, line.find('\n'));
  }
  void set(const std::string& source, const std::string& key, const std::string& value) {
    ASSERT_EQ(run("hearthctl settings set " + source + " " + key + " " + value).status, 0);
  }
  void overrideSeconds(const std::string& seconds) {
    set("user", "VelaLogCloudCollectionExpirationIntervalOverride", seconds);
  }
  bool hasAlarm() { return run("hearthctl alarms").output.find(flagKey) != std::string::npos; }
  bool isOn() { return run("pairwellctl logging").output.starts_with("on until "); }
  bool isAllOff() {
    return setting("root", flagKey) != "true" && setting("cloud", flagKey) != "true" &&
           setting("cloud", endKey).empty() && !hasAlarm();
  }
  // The end of the new period.
  double switchOn() {
    EXPECT_EQ(run("pairwellctl logging on").status, 0);
    EXPECT_TRUE(eventually([&] { return hasAlarm(); })) << log();
    return std::atof(setting("cloud", endKey).c_str());
  }
  static double now() { return static_cast<double>(std::time(nullptr)); }
};

TEST_F(SystemTest, PeriodRunsItsCourseAndEndsByItsAlarm) {
  start();
  // A value set by a tool is what the very next switch uses.
  for (const int seconds : {1000, 2000, 3000}) {
    overrideSeconds(std::to_string(seconds));
    EXPECT_NEAR(switchOn(), now() + seconds, 10);
    ASSERT_EQ(run("pairwellctl logging off").status, 0);
    ASSERT_TRUE(eventually([&] { return isAllOff(); }));
  }
  overrideSeconds("5");  // long enough to be looked at on a busy machine
  EXPECT_NEAR(switchOn(), now() + 3, 4);
  EXPECT_EQ(setting("root", flagKey) + setting("cloud", flagKey), "truetrue");
  EXPECT_EQ(run("pairwellctl status").output.substr(0, 26), "1 Kestrel Audio Accessory\n");
  ASSERT_TRUE(eventually([&] { return isAllOff(); })) << log();
  EXPECT_EQ(run("pairwellctl logging").output, "off\n");
  EXPECT_EQ(run("hearthctl check").status, 0);
  EXPECT_FALSE(logged("Cloud KVS Notification")) << "own writes are no outside changes";
  const auto heard = timesLogged("Root KVS Notification");
  ASSERT_EQ(run("hearthctl notify post com.kestrel.bluetooth.prefsChanged").status, 0);
  EXPECT_TRUE(eventually([&] { return timesLogged("Root KVS Notification") > heard; }));
}

TEST_F(SystemTest, PeriodOutlivesEveryProcessAndKeepsItsEnd) {
  start();
  const double end = switchOn();
  const auto stillRuns = [&] { return isOn() && std::atof(setting("cloud", endKey).c_str()) == end; };
  const pid_t first = pairwelld();
  ::kill(first, SIGKILL);
  ASSERT_TRUE(eventually([&] { return pairwelld() > 0 && pairwelld() != first; }));
  EXPECT_TRUE(stillRuns());

  const pid_t second = pairwelld();
  stop(SIGKILL);
  start();
  EXPECT_NE(pairwelld(), second);
  EXPECT_TRUE(stillRuns());
  EXPECT_TRUE(logged("This is *NOT* the first run since reboot"));

  stop();
  write("etc/device.json",
        R"({"BuildVersion": "22B100", "BootSessionUUID": "00000000-0000-4000-8000-000000000001"})");
  start();
  EXPECT_TRUE(logged("Migrating from "));
  EXPECT_EQ(timesLogged("First launch since boot..."), 2u);
  EXPECT_TRUE(stillRuns());
  EXPECT_EQ(run("hearthctl check").status, 0);
}

TEST_F(SystemTest, StockClientsAndTheCommandLineAreAnsweredAlike) {
  for (const std::string client : {"busctl", "gdbus"}) {
    fs::copy_file("/usr/bin/" + client, root / "bin" / client);
    write("etc/entitlements.d/" + client + ".json",
          R"({"executable": "bin/)" + client +
              R"(", "entitlements": {"com.kestrel.bluetooth.internal": true}})");
  }
  start();
  const pid_t watcher = spawn("pairwellctl watch", "watch");
  ASSERT_TRUE(eventually([&] {
    EXPECT_EQ(run("pairwellctl status set 3").status, 0);
    EXPECT_EQ(run("pairwellctl status set 0").status, 0);
    return contents(root / "watch.out").find("off\n") != std::string::npos;
  }));
  EXPECT_EQ(run("pairwellctl status set 3").status, 0);
  ASSERT_TRUE(eventually([&] { return run("pairwellctl status").output == "1 Kestrel Audio Accessory\n"; }));
  EXPECT_TRUE(eventually([&] {
    const std::string lines = contents(root / "watch.out");
    return lines.rfind("on until ") > lines.rfind("off\n") && lines.ends_with("\n");
  }));
  const std::string address =
      "unix:path=" + platform::linux_::Paths::under(root).serviceSocket("com.kestrel.pairwell.conduit");
  const std::string object = "/com/kestrel/pairwell/conduit",
                    interface = "com.kestrel.pairwell.RadixUserController";
  EXPECT_EQ(run("busctl --address=" + address + " call x.y " + object + " " + interface +
                " KestrelAudioAccessoryLimitedLogging")
                .output,
            "b true\n");
  EXPECT_EQ(run("gdbus call --address " + address + " --dest x.y --object-path " + object + " --method " +
                interface + ".GetCurrentUserGivenName")
                .output,
            "([''],)\n");
  EXPECT_THAT(run("pairwellctl --json logging").output, HasSubstr("\"logging\":true"));
  stop();
  EXPECT_EQ(finish(watcher, "watch").status, 3) << "hearthd has gone";
}

TEST_F(SystemTest, StrangersAreToldSo) {
  fs::copy_file(root / "bin/pairwellctl", root / "bin/stranger");
  start();
  const fs::path descriptors = "/proc/" + std::to_string(pairwelld()) + "/fd";
  const auto open = [&] { return std::distance(fs::directory_iterator(descriptors), {}); };
  const auto before = open();
  write("bin/many", "for i in $(seq 200); do stranger status; [ $? -eq 4 ] || exit 1; done");
  EXPECT_EQ(run("sh " + (root / "bin/many").string()).status, 0);
  EXPECT_EQ(timesLogged("Conduit connection denied, "), 200u);
  EXPECT_EQ(timesLogged(", add com.kestrel.bluetooth.system entitlement"), 200u);
  EXPECT_TRUE(eventually([&] { return open() <= before; }));
  EXPECT_EQ(run("pairwellctl --timeout 5 status").status, 0);
}

TEST_F(SystemTest, ProcessStartedWronglySaysOneThingAndTouchesNothing) {
  fs::remove_all(root / "etc");
  EXPECT_EQ(run("env -u CONDUIT_SERVICE_NAME pairwelld").status, -SIGABRT);
  EXPECT_EQ(contents(root / "run.err"), "pairwelld must be run from hearthd\n");
  EXPECT_FALSE(fs::exists(root / "var"));
  const Outcome ended = run("env CONDUIT_SERVICE_NAME=x pairwelld");
  EXPECT_EQ(ended.status, 1);
  EXPECT_THAT(ended.errors, testing::ContainsRegex("^[^\n]*there is no link to hearthd[^\n]*\n$"));
  EXPECT_FALSE(fs::exists(root / "var"));
}

TEST_F(SystemTest, TerminationAtAnyMomentIsClean) {
  const std::string service =
      platform::linux_::Paths::under(root).serviceSocket("com.kestrel.pairwell.conduit");
  std::mt19937 random(7);
  for (std::size_t round = 0; round < 6; ++round) {
    start();
    const auto silent = fakes::socketAt(service, ::connect);
    ASSERT_TRUE(silent);
    std::thread busy([&] {
      for (int call = 0; call < 4; ++call) {
        for (const char* word : {"on", "off"}) run(std::string("pairwellctl logging ") + word);
      }
    });
    // The moment itself is what varies.
    std::this_thread::sleep_for(std::chrono::milliseconds(random() % 60));
    EXPECT_EQ(stop(), 0) << log();
    busy.join();
    EXPECT_EQ(timesLogged("com.kestrel.pairwelld exited with status 0"), round + 1) << log();
    EXPECT_FALSE(logged("killed")) << log();
  }
}

}  // namespace
}  // namespace processes
