// The operator's command line, without hearthd and with a real one.
#include <algorithm>

#include "tests/system/Device.hpp"

namespace processes {
namespace {

struct HearthctlTest : Device {
  HearthctlTest() { ::setenv("EDITOR", "false", 1); }

  Outcome ctl(const std::string& arguments) { return run("hearthctl " + arguments); }
  Outcome edit(const std::string& source, const std::string& script) {
    write("editor", script + "\n");
    return run("env VISUAL='sh " + (root / "editor").string() + "' hearthctl settings edit " + source);
  }
  // Without a value: removes the key.
  Outcome set(const std::string& source, const std::string& key, const std::string& value) {
    if (value.empty()) return ctl("settings unset " + source + " " + key);
    return ctl("settings set " + source + " " + key + " " + value);
  }
  void setAlarm(const std::string& seconds) {
    const std::string entry = R"({"job": "com.kestrel.pairwelld", "stream": "com.kestrel.alarm", "name": ")" +
                              flagKey + R"(", "generation": 1, "date": {"$date": )" + seconds + "000000000}}";
    write("var/hearthd/alarms.json",
          R"({"lastGeneration": 1, "alarms": [)" + (seconds.empty() ? "" : entry) + "]}");
  }

  const std::string userFile = "var/settings/user/com.kestrel.pairwelld.json";
};

TEST_F(HearthctlTest, ValuesAreWhatTheyLookLikeOrAreSaidToBe) {
  const std::pair<const char*, const char*> rows[] = {{"true", "true"},
                                                      {"2.5e3", "2500.0"},
                                                      {"'a b'", R"("a b")"},
                                                      {"5 --type string", R"("5")"},
                                                      {"inf --type double", R"({"$double":"inf"})"}};
  for (const std::string source : {"user", "root", "cloud"}) {
    for (const auto& [value, stored] : rows) {
      EXPECT_EQ(set(source, "key", value).status, 0);
      EXPECT_EQ(ctl("settings get " + source + " key --json").output,
                R"({"key":"key","value":)" + std::string(stored) + "}\n");
    }
    EXPECT_EQ(set(source, "key", "yes --type bool").status, 2);
    EXPECT_EQ(ctl("settings list " + source).output, "key  inf\n");
    EXPECT_EQ(set(source, "key", "").status, 0);
    const Outcome absent = ctl("settings get " + source + " key");
    EXPECT_EQ(absent.status, 1);
    EXPECT_EQ(absent.output + absent.errors, "");
  }
  EXPECT_EQ(ctl("settings get elsewhere key").status, 2);
}

TEST_F(HearthctlTest, EditInstallsTheChangesAndLosesNothing) {
  for (const std::string source : {"user", "cloud"}) {
    set(source, "mine", "1");
    set(source, "kept", "1");
    // Somebody else writes while the editor is open.
    const Outcome good = edit(
        source, "hearthctl settings set " + source + " theirs 3 && sed -i 's/\"mine\": 1/\"mine\": 2/' $1");
    EXPECT_EQ(good.status, 0) << good.errors;
    EXPECT_EQ(ctl("settings list " + source).output, "kept    1\nmine    2\ntheirs  3\n");
  }
  const Outcome bad = edit("user", "printf '{\\n oops' > $1");
  EXPECT_EQ(bad.status, 1);
  EXPECT_THAT(bad.errors, HasSubstr(".json: line 2, column "));
  const fs::path copy = bad.errors.substr(11, bad.errors.find(':', 11) - 11);
  EXPECT_EQ(contents(copy), "{\n oops");
  fs::remove(copy);
  EXPECT_EQ(ctl("settings get user mine").output, "2\n");
}

TEST_F(HearthctlTest, DamagedStoreIsNamedLeftAloneAndMended) {
  const std::string damaged = "{\"values\": {\"key\": 1},\n oops}";
  write(userFile, damaged);
  for (const char* command : {"settings list user", "settings set user k 1"}) {
    const Outcome outcome = ctl(command);
    EXPECT_EQ(outcome.status, 1);
    EXPECT_THAT(outcome.errors, HasSubstr(userFile + ": line 2, column "));
    EXPECT_EQ(contents(root / userFile), damaged);
  }
  EXPECT_THAT(ctl("check").output, HasSubstr("remedy: hearthctl settings edit user"));
  EXPECT_EQ(edit("user", "sed -i '1s/,$//; s/oops//' $1").status, 0);
  EXPECT_EQ(ctl("settings list user").output, "key  1\n");
  EXPECT_EQ(contents(root / (userFile + ".damaged-1")), damaged);
  EXPECT_THAT(ctl("check").output, HasSubstr(".damaged-1: was damaged"));
}

TEST_F(HearthctlTest, CheckNamesEachResidueWithItsRemedy) {
  const struct {
    const char *rootFlag, *cloudFlag, *end, *alarm, *problem;
    std::string remedy;
  } rows[] = {
      {"true", "false", "", "", "root flag is on, and the cloud",
       "hearthctl settings set root " + flagKey + " false"},
      {"false", "true", "4000000000.5", "4000000000", "cloud flag is on, and the root", "start hearthd"},
      {"false", "false", "4000000000.5", "", "2096-10-02T08:06:40+0100; the next \"on\" takes it up",
       "hearthctl settings unset cloud " + endKey},
      {"false", "false", "1000000000", "", "a second one is needed",
       "hearthctl settings unset cloud " + endKey},
      {"false", "false", "", "4000000000", "alarm is left", "hearthctl alarms cancel " + flagKey},
      {"true", "true", "4000000000.5", "", "no alarm for the end", "start hearthd"},
      {"true", "true", "4000000000.5", "4000000001", "not at the end", "start hearthd"},
      {"true", "true", "1000000000", "", "the end has passed", "start hearthd"},
      {"true", "true", "", "4000000000", "without an end time", "pairwellctl logging off"}};
  EXPECT_THAT(ctl("check").output, HasSubstr("etc: there is no device"));
  fs::create_directory(root / "etc");
  for (const auto& row : rows) {
    SCOPED_TRACE(row.problem);
    EXPECT_THAT(set("root", flagKey, row.rootFlag).errors, HasSubstr("nobody was told"));
    set("cloud", flagKey, row.cloudFlag);
    set("cloud", endKey, row.end);
    setAlarm(row.alarm);
    const Outcome outcome = ctl("check");
    EXPECT_EQ(outcome.status, 1);
    EXPECT_THAT(outcome.output, AllOf(HasSubstr(row.problem), HasSubstr(row.remedy)));
    EXPECT_EQ(std::count(outcome.output.begin(), outcome.output.end(), '\n'), 2) << outcome.output;
    EXPECT_THAT(outcome.errors, HasSubstr("var/hearthd/alarms.json"));
    if (!row.remedy.starts_with("hearthctl settings")) continue;
    EXPECT_EQ(run(row.remedy).status, 0);
    EXPECT_EQ(ctl("check").status, 0) << "the remedy works";
  }
  set("cloud", endKey, "4000000000.5");
  setAlarm("4000000000");
  EXPECT_EQ(ctl("check").status, 0);
  write("var/hearthd/alarms.json", "[");
  EXPECT_THAT(ctl("check").output, HasSubstr("alarms.json: line 1"));
}

TEST_F(HearthctlTest, InitKeepsWhatIsThereAndGrantsSayWhatDoesNotCount) {
  write("etc/device.json", R"({"BuildVersion": "1A1"})");
  const Outcome outcome = ctl("init --build 2B2");
  EXPECT_EQ(outcome.status, 0);
  EXPECT_THAT(outcome.output, AllOf(HasSubstr("kept     " + (root / "etc/device.json").string()),
                                    HasSubstr("written  " + (root / "etc/jobs").string())));
  EXPECT_EQ(contents(root / "etc/device.json"), R"({"BuildVersion": "1A1"})");
  const std::string executable = root / "bin/pairwellctl";
  EXPECT_EQ(ctl("grants").output,
            "pairwellctl.json  " + executable + "  anyone  [\"com.kestrel.bluetooth.system\": true]\n");
  EXPECT_EQ(ctl("check").status, 0);
  fs::permissions(executable, fs::perms(0777));
  const std::string problem = executable + " can be written by others";
  EXPECT_THAT(ctl("grants --json").output, AllOf(HasSubstr("\"counts\":false"), HasSubstr(problem)));
  EXPECT_THAT(ctl("check").output, HasSubstr(problem));
}

TEST_F(HearthctlTest, RunningDeviceIsOperated) {
  EXPECT_EQ(ctl("jobs").status, 3);
  ctl("init --device-name test");
  start();
  EXPECT_THAT(ctl("jobs").output, HasSubstr("com.kestrel.pairwelld  running  "));
  const std::string name = "com.kestrel.bluetooth.prefsChanged", watch = "hearthctl notify watch ";
  const auto endless = spawn(watch + name, "endless");
  const auto counted = spawn(watch + "other " + name + " --count 1", "counted");
  // A watch has begun once it prints.
  EXPECT_TRUE(eventually([&] {
    EXPECT_EQ(set("root", "key", "1").errors, "");
    return contents(root / "counted.out") != "" && contents(root / "endless.out") != "";
  }));
  EXPECT_TRUE(contents(root / "endless.out").ends_with(name + "\n")) << "a full buffer ends anywhere";
  ::kill(endless, SIGTERM);
  EXPECT_EQ(finish(endless, "endless").status, -SIGTERM);
  const Outcome watched = finish(counted, "counted");
  EXPECT_EQ(watched.status, 0);
  EXPECT_EQ(watched.output, name + "\n");
  EXPECT_EQ(ctl("notify watch never --count 1 --timeout 0.01").status, 3);
  const Outcome unknown = ctl("event com.kestrel.nobody x");
  EXPECT_EQ(unknown.status, 1);
  EXPECT_THAT(unknown.errors, HasSubstr("hearthd.sock: no job consumes com.kestrel.nobody\n"));

  EXPECT_EQ(run("pairwellctl logging on").status, 0);
  EXPECT_TRUE(eventually([&] { return ctl("alarms").output != ""; }));
  EXPECT_THAT(ctl("alarms").output,
              HasSubstr("com.kestrel.pairwelld  com.kestrel.alarm  " + flagKey + "  20"));
  EXPECT_EQ(ctl("check").output, "all stores and alarms agree\n");
  EXPECT_EQ(ctl("alarms cancel " + flagKey + " --json").output, "{\"cancelled\":1}\n");
  EXPECT_EQ(ctl("alarms cancel " + flagKey).status, 1);
  EXPECT_THAT(ctl("check").output, HasSubstr("remedy: hearthctl jobs restart com.kestrel.pairwelld"));
  EXPECT_EQ(ctl("jobs restart com.kestrel.pairwelld").status, 0);
  EXPECT_TRUE(eventually([&] { return ctl("check").status == 0; })) << ctl("check").output;
  EXPECT_EQ(ctl("event com.kestrel.alarm " + flagKey).status, 0);
  EXPECT_TRUE(eventually([&] { return ctl("settings get cloud " + flagKey).output == "false\n"; }));
  EXPECT_EQ(ctl("jobs stop nobody").status, 1);
  for (const auto& [verb, state] : {std::pair("stop", "stopped"), {"start", "running"}}) {
    EXPECT_EQ(ctl(std::string("jobs ") + verb + " com.kestrel.pairwelld").status, 0);
    EXPECT_TRUE(
        eventually([&, state = state] { return ctl("jobs").output.find(state) != std::string::npos; }));
  }
  if (::geteuid() != 0) GTEST_SKIP() << "only root can be another user";
  EXPECT_EQ(run("hearthctl jobs stop com.kestrel.pairwelld", nobody).status, 4);
}

}  // namespace
}  // namespace processes
