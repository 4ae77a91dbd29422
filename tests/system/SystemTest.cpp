#include <sys/socket.h>
#include <sys/un.h>

#include <cmath>
#include <random>

#include "platform/linux/UniqueDescriptor.hpp"
#include "tests/system/Device.hpp"

namespace pairwell_system {
namespace {

using platform::linux_::UniqueDescriptor;

class SystemTest : public Device {
 protected:
  UniqueDescriptor connectToService() {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    platform::linux_::Paths::under(root)
        .serviceSocket("com.kestrel.pairwell.conduit")
        .copy(address.sun_path, sizeof address.sun_path - 1);
    UniqueDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) < 0)
      socket.reset();
    return socket;
  }
  static std::ptrdiff_t descriptors(pid_t process) {
    return std::distance(fs::directory_iterator("/proc/" + std::to_string(process) + "/fd"), {});
  }
  void overrideSeconds(const std::string& seconds) {
    ASSERT_EQ(run("hearthctl settings set user " + std::string(overrideKey) + " " + seconds).status, 0);
  }
};

TEST_F(SystemTest, PeriodRunsItsCourseAndEndsByItsAlarm) {
  start();
  EXPECT_TRUE(logged("First launch since boot..."));
  overrideSeconds("2");
  ASSERT_EQ(run("pairwellctl logging on").status, 0);
  ASSERT_TRUE(eventually([&] { return run("hearthctl alarms").output.find(flagKey) != std::string::npos; }));
  EXPECT_EQ(setting("root", flagKey), "true");
  EXPECT_EQ(setting("cloud", flagKey), "true");
  const double now = static_cast<double>(std::time(nullptr));
  EXPECT_NEAR(std::stod(setting("cloud", endKey)), now, 3);
  EXPECT_THAT(run("pairwellctl logging").output, StartsWith("on until "));
  EXPECT_THAT(run("pairwellctl status").output, StartsWith("1 Kestrel Audio Accessory"));
  ASSERT_TRUE(eventually([&] { return isAllOff(); })) << log();
  EXPECT_EQ(run("pairwellctl logging").output, "off\n");
  EXPECT_EQ(run("hearthctl check").status, 0);
}

TEST_F(SystemTest, OverrideSetByAToolIsUsedByTheNextSwitch) {
  start();
  for (int seconds = 1000; seconds < 1020; ++seconds) {
    overrideSeconds(std::to_string(seconds));
    ASSERT_EQ(run("pairwellctl logging on").status, 0);
    ASSERT_TRUE(eventually([&] { return !setting("cloud", endKey).empty(); }));
    const double length = std::stod(setting("cloud", endKey)) - static_cast<double>(std::time(nullptr));
    EXPECT_TRUE(logged("override " + std::to_string(seconds) + ".0")) << length;
    ASSERT_EQ(run("pairwellctl logging off").status, 0);
    ASSERT_TRUE(eventually([&] { return isAllOff(); }));
  }
}

TEST_F(SystemTest, PeriodOutlivesEveryProcessAndKeepsItsEnd) {
  start();
  ASSERT_EQ(run("pairwellctl logging on").status, 0);
  ASSERT_TRUE(eventually([&] { return run("hearthctl alarms").output.find(flagKey) != std::string::npos; }));
  const std::string end = setting("cloud", endKey);
  const pid_t first = pairwelld();
  ::kill(first, SIGKILL);
  ASSERT_TRUE(restartedAfter(first));
  EXPECT_TRUE(isOn());
  EXPECT_EQ(setting("cloud", endKey), end);

  const pid_t second = pairwelld();
  stop(SIGKILL);
  start();
  EXPECT_NE(pairwelld(), second);
  EXPECT_TRUE(isOn());
  EXPECT_EQ(setting("cloud", endKey), end);
  EXPECT_TRUE(logged("This is *NOT* the first run since reboot"));

  stop();
  std::ofstream(root / "etc/device.json")
      << R"({"BuildVersion": "22B100", "BootSessionUUID": "00000000-0000-4000-8000-000000000001"})";
  start();
  EXPECT_TRUE(logged("Migrating from "));
  EXPECT_EQ(timesLogged("First launch since boot..."), 2u);
  EXPECT_TRUE(isOn());
  EXPECT_EQ(run("hearthctl check").status, 0);
}

TEST_F(SystemTest, PeriodThatRanOutWhileNothingRanIsEndedAtTheStart) {
  start();
  overrideSeconds("1");
  ASSERT_EQ(run("pairwellctl logging on").status, 0);
  ASSERT_TRUE(eventually([&] { return run("hearthctl alarms").output.find(flagKey) != std::string::npos; }));
  const double end = std::stod(setting("cloud", endKey));
  stop();
  ASSERT_TRUE(eventually([&] { return static_cast<double>(std::time(nullptr)) > end + 1; }));
  start();
  ASSERT_TRUE(eventually([&] { return isAllOff(); })) << log();
  overrideSeconds("1000");
  // The stale alarm, which hearthd still held, must not end what begins now.
  ASSERT_EQ(run("pairwellctl logging on").status, 0);
  ASSERT_TRUE(eventually([&] { return isOn(); }));
  ASSERT_TRUE(eventually([&] { return static_cast<double>(std::time(nullptr)) > end + 4; }));
  EXPECT_TRUE(isOn());
}

TEST_F(SystemTest, ChangesFromOutsideAreFollowed) {
  start();
  ASSERT_EQ(run("hearthctl settings set cloud " + std::string(flagKey) + " true").status, 0);
  ASSERT_TRUE(eventually([&] { return setting("root", flagKey) == "true"; })) << log();
  EXPECT_TRUE(logged("Cloud KVS Notification: [\"ChangeReason\": 0, \"ChangedKeys\": [\"" +
                     std::string(flagKey) + "\"]]"))
      << log();
  EXPECT_TRUE(eventually([&] { return isOn(); }));
  ASSERT_EQ(run("hearthctl settings set cloud " + std::string(flagKey) + " false").status, 0);
  ASSERT_TRUE(eventually([&] { return isAllOff(); })) << log();
  EXPECT_EQ(timesLogged("Cloud KVS Notification"), 2u) << "own writes are no outside changes";
  ASSERT_EQ(run("hearthctl notify post com.kestrel.bluetooth.prefsChanged").status, 0);
  EXPECT_TRUE(eventually([&] { return logged("Root KVS Notification"); }));
}

TEST_F(SystemTest, RefusalsAreToldAsSuchAndLeaveNothing) {
  start();
  ASSERT_EQ(run("pairwellctl status").status, 0);
  const pid_t daemon = pairwelld();
  const auto before = descriptors(daemon);
  constexpr int rounds = 40;
  for (int round = 0; round < rounds; ++round) ASSERT_EQ(run("stranger status").status, 4) << log();
  EXPECT_TRUE(eventually([&] {
    return timesLogged("Conduit connection denied, ") == rounds &&
           timesLogged(", add com.kestrel.bluetooth.system entitlement") == rounds;
  }));
  EXPECT_TRUE(eventually([&] { return descriptors(daemon) <= before; }));
  EXPECT_EQ(run("pairwellctl --timeout 5 status").status, 0);
}

TEST_F(SystemTest, ProcessStartedWronglySaysOneThingAndTouchesNothing) {
  const std::string daemon = (root / "bin/pairwelld").string();
  const std::string to = " 2>" + (root / "err").string();
  const std::string environment = "HEARTH_ROOT=" + root.string();
  fs::remove_all(root / "etc");
  const int stopped = std::system(("exec env -i " + environment + " " + daemon + to).c_str());
  EXPECT_TRUE(WIFSIGNALED(stopped) || WEXITSTATUS(stopped) == 128 + SIGABRT);
  EXPECT_EQ(contents(root / "err"), "pairwelld must be run from hearthd\n");
  EXPECT_FALSE(fs::exists(root / "var"));
  const int ended = std::system(
      ("exec env -i " + environment + " HEARTH_LOG_LEVEL=error CONDUIT_SERVICE_NAME=x " + daemon + to)
          .c_str());
  EXPECT_EQ(WEXITSTATUS(ended), 1);
  EXPECT_THAT(contents(root / "err"), HasSubstr("there is no link to hearthd"));
}

TEST_F(SystemTest, DamagedStoresAreMovedAsideAndTheDaemonRunsOn) {
  const auto paths = platform::linux_::Paths::under(root);
  for (const auto& file : {paths.userSettings(), paths.rootSettings(),
                           paths.cloudSettings("com.kestrel.bluetooth.cloud.settings")}) {
    fs::create_directories(fs::path(file).parent_path());
    std::ofstream(file) << "{\"values\": {\n  oops";
  }
  start();
  ASSERT_EQ(run("pairwellctl logging on").status, 0);
  ASSERT_TRUE(eventually([&] { return isOn() && setting("root", flagKey) == "true"; })) << log();
  for (const auto& file : {paths.userSettings(), paths.rootSettings()}) {
    int kept = 0;
    for (const auto& entry : fs::directory_iterator(fs::path(file).parent_path())) {
      if (contents(entry.path()).find("oops") != std::string::npos) ++kept;
    }
    EXPECT_EQ(kept, 1) << file;
    EXPECT_TRUE(logged(file)) << log();
  }
}

TEST_F(SystemTest, TerminationAtAnyMomentIsCleanAndLosesNoAcceptedSwitch) {
  std::mt19937 random(7);
  for (int round = 0; round < 6; ++round) {
    start();
    const auto client = connectToService();
    ASSERT_TRUE(client);
    std::thread busy([&] {
      for (int call = 0; call < 8; ++call)
        run(call % 2 == 0 ? "pairwellctl logging on" : "pairwellctl logging off");
    });
    std::this_thread::sleep_for(
        std::chrono::milliseconds(random() % 60));  // the moment itself is what varies
    ::kill(hearthd, SIGTERM);
    ::waitpid(hearthd, &status, 0);
    hearthd = -1;
    busy.join();
    EXPECT_EQ(status, 0) << log();
    EXPECT_EQ(timesLogged("com.kestrel.pairwelld exited with status 0"), round + 1u) << log();
    EXPECT_FALSE(logged("killed")) << log();
  }
}

}  // namespace
}  // namespace pairwell_system
