// The operator's command line, run on a temporary root, without hearthd and with a real one.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

namespace {

namespace fs = std::filesystem;
using testing::AllOf;
using testing::HasSubstr;

const std::string flag = "VelaLogCloudCollectionEnabled";
const std::string end = flag + "Expiration";

bool eventually(const std::function<bool()>& condition) {
  const auto last = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (!condition()) {
    if (std::chrono::steady_clock::now() > last) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return true;
}

std::string contents(const fs::path& path) {
  std::ifstream file(path);
  return {std::istreambuf_iterator<char>(file), {}};
}

struct Outcome {
  int status = -1;
  std::string output;
  std::string errors;
};

class HearthctlTest : public testing::Test {
 protected:
  // The programs lie in the root: a build folder may be one in which no grant counts.
  HearthctlTest() {
    std::string name = (fs::temp_directory_path() / "hearthctlXXXXXX").string();
    root = ::mkdtemp(name.data());
    fs::permissions(root, fs::perms(0755));  // for clients of other users
    fs::create_directories(root / "bin");
    for (const char* program : {"hearthctl", "hearthd", "pairwelld", "pairwellctl"}) {
      fs::copy_file(fs::path(PROGRAMS) / program, root / "bin" / program);
    }
    ::setenv("TZ", "EAST-1", 1);
    ::setenv("EDITOR", "false", 1);
  }
  ~HearthctlTest() override {
    if (hearthd > 0) {
      ::kill(hearthd, SIGTERM);
      ::waitpid(hearthd, nullptr, 0);
    }
    fs::remove_all(root);
  }

  pid_t spawn(const std::string& program, std::vector<std::string> arguments, const std::string& log,
              uid_t user = 0) {
    const pid_t pid = ::fork();
    if (pid != 0) return pid;
    ::dup2(::open((root / (log + ".out")).c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600), STDOUT_FILENO);
    ::dup2(::open((root / (log + ".err")).c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600), STDERR_FILENO);
    ::setenv("HEARTH_ROOT", root.c_str(), 1);
    std::vector<char*> list{const_cast<char*>(program.c_str())};
    for (std::string& argument : arguments) list.push_back(argument.data());
    list.push_back(nullptr);
    if (user == 0 || ::setuid(user) == 0) ::execv((root / "bin" / program).c_str(), list.data());
    ::_exit(126);
  }
  Outcome finish(pid_t pid, const std::string& log) {
    int status = 0;
    if (!eventually([&] { return ::waitpid(pid, &status, WNOHANG) == pid; })) {
      ::kill(pid, SIGKILL);
      ::waitpid(pid, &status, 0);
    }
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, contents(root / (log + ".out")),
            contents(root / (log + ".err"))};
  }
  Outcome run(std::vector<std::string> arguments, uid_t user = 0) {
    return finish(spawn("hearthctl", std::move(arguments), "run", user), "run");
  }
  Outcome edit(const std::string& source, const std::string& script) {
    write("editor", "#!/bin/sh\n" + script + "\n");
    ::setenv("VISUAL", ("sh " + (root / "editor").string()).c_str(), 1);
    return run({"settings", "edit", source});
  }
  void write(const fs::path& path, const std::string& text) {
    fs::create_directories((root / path).parent_path());
    std::ofstream(root / path) << text;
  }
  void start() {
    hearthd = spawn("hearthd", {}, "hearthd");
    ASSERT_TRUE(eventually(
        [&] { return contents(root / "hearthd.err").find("hearthd: ready\n") != std::string::npos; }));
  }

  fs::path root;
  pid_t hearthd = -1;
  const fs::path userFile = "var/settings/user/com.kestrel.pairwelld.json";
};

TEST_F(HearthctlTest, ValuesAreWhatTheyLookLikeOrAreSaidToBe) {
  const struct {
    std::vector<std::string> value;
    const char* stored;
  } rows[] = {{{"true"}, "true"},
              {{"-5"}, "-5"},
              {{"2.5e3"}, "2500.0"},
              {{"inf"}, R"("inf")"},
              {{"a b"}, R"("a b")"},
              {{"5", "--type", "string"}, R"("5")"},
              {{"5", "--type", "double"}, "5.0"},
              {{"inf", "--type", "double"}, R"({"$double":"inf"})"}};
  for (const char* source : {"user", "root", "cloud"}) {
    for (const auto& [value, stored] : rows) {
      std::vector<std::string> arguments{"settings", "set", source, "key"};
      arguments.insert(arguments.end(), value.begin(), value.end());
      EXPECT_EQ(run(arguments).status, 0);
      EXPECT_EQ(run({"settings", "get", source, "key", "--json"}).output,
                R"({"key":"key","value":)" + std::string(stored) + "}\n");
    }
    EXPECT_EQ(run({"settings", "set", source, "key", "yes", "--type", "bool"}).status, 2);
    EXPECT_EQ(run({"settings", "list", source}).output, "key  inf\n");
    EXPECT_EQ(run({"settings", "unset", source, "key"}).status, 0);
    const Outcome absent = run({"settings", "get", source, "key"});
    EXPECT_EQ(absent.status, 1);
    EXPECT_EQ(absent.output + absent.errors, "");
  }
  EXPECT_EQ(run({"settings", "get", "elsewhere", "key"}).status, 2);
}

TEST_F(HearthctlTest, EditInstallsTheChangesAndLosesNothing) {
  const std::string ctl = (root / "bin/hearthctl").string();
  for (const char* source : {"user", "cloud"}) {
    run({"settings", "set", source, "mine", "1"});
    run({"settings", "set", source, "kept", "1"});
    // Somebody else writes while the editor is open.
    const Outcome good =
        edit(source, ctl + " settings set " + source + " theirs 3 && sed -i 's/\"mine\": 1/\"mine\": 2/' $1");
    EXPECT_EQ(good.status, 0) << good.errors;
    EXPECT_EQ(run({"settings", "list", source}).output, "kept    1\nmine    2\ntheirs  3\n");
  }
  const Outcome bad = edit("user", "printf '{\\n oops' > $1");
  EXPECT_EQ(bad.status, 1);
  EXPECT_THAT(bad.errors, HasSubstr(".json: line 2, column "));
  const fs::path copy = bad.errors.substr(11, bad.errors.find(':', 11) - 11);
  EXPECT_EQ(contents(copy), "{\n oops");
  fs::remove(copy);
  EXPECT_EQ(run({"settings", "get", "user", "mine"}).output, "2\n");
}

TEST_F(HearthctlTest, DamagedStoreIsNamedLeftAloneAndMended) {
  const std::string damaged = "{\"values\": {\"key\": 1},\n oops}";
  write(userFile, damaged);
  for (const std::vector<std::string>& arguments :
       {std::vector<std::string>{"settings", "list", "user"}, {"settings", "set", "user", "k", "1"}}) {
    const Outcome outcome = run(arguments);
    EXPECT_EQ(outcome.status, 1);
    EXPECT_THAT(outcome.errors, HasSubstr(userFile.string() + ": line 2, column "));
    EXPECT_EQ(contents(root / userFile), damaged);
  }
  EXPECT_THAT(run({"check"}).output, HasSubstr("remedy: hearthctl settings edit user"));
  EXPECT_EQ(edit("user", "sed -i '1s/,$//; s/oops//' $1").status, 0);
  EXPECT_EQ(run({"settings", "list", "user"}).output, "key  1\n");
  EXPECT_EQ(contents((root / userFile).string() + ".damaged-1"), damaged);
  EXPECT_THAT(run({"check"}).output, HasSubstr(".damaged-1: was damaged"));
}

TEST_F(HearthctlTest, CheckNamesEachResidueWithItsRemedy) {
  const struct {
    const char *rootFlag, *cloudFlag, *end, *alarm, *problem;
    std::string remedy;
  } rows[] = {
      {"true", "false", "", "", "root flag is on, and the cloud",
       "hearthctl settings set root " + flag + " false"},
      {"false", "true", "4000000000.5", "4000000000", "cloud flag is on, and the root", "start hearthd"},
      {"false", "false", "4000000000.5", "", "2096-10-02T08:06:40+0100; the next \"on\" takes it up",
       "hearthctl settings unset cloud " + end},
      {"false", "false", "1000000000", "", "a second one is needed", "hearthctl settings unset cloud " + end},
      {"false", "false", "", "4000000000", "alarm is left", "hearthctl alarms cancel " + flag},
      {"true", "true", "4000000000.5", "", "no alarm for the end", "start hearthd"},
      {"true", "true", "4000000000.5", "4000000001", "not at the end", "start hearthd"},
      {"true", "true", "1000000000", "", "the end has passed", "start hearthd"},
      {"true", "true", "", "4000000000", "without an end time", "pairwellctl logging off"}};
  const auto set = [&](const char* source, const std::string& key, const std::string& value) {
    if (value.empty()) return run({"settings", "unset", source, key});
    return run({"settings", "set", source, key, value});
  };
  const auto setAlarm = [&](const std::string& seconds) {
    const std::string entry = R"({"job": "com.kestrel.pairwelld", "stream": "com.kestrel.alarm", "name": ")" +
                              flag + R"(", "generation": 1, "date": {"$date": )" + seconds + "000000000}}";
    write("var/hearthd/alarms.json",
          R"({"lastGeneration": 1, "alarms": [)" + (seconds.empty() ? "" : entry) + "]}");
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.problem);
    EXPECT_THAT(set("root", flag, row.rootFlag).errors, HasSubstr("nobody was told"));
    set("cloud", flag, row.cloudFlag);
    set("cloud", end, row.end);
    setAlarm(row.alarm);
    const Outcome outcome = run({"check"});
    EXPECT_EQ(outcome.status, 1);
    EXPECT_THAT(outcome.output, AllOf(HasSubstr(row.problem), HasSubstr(row.remedy)));
    EXPECT_EQ(std::count(outcome.output.begin(), outcome.output.end(), '\n'), 2) << outcome.output;
    EXPECT_THAT(outcome.errors, HasSubstr("var/hearthd/alarms.json"));
    if (row.remedy.rfind("hearthctl settings", 0) != 0) continue;
    std::istringstream words(row.remedy.substr(10));
    EXPECT_EQ(run({std::istream_iterator<std::string>(words), {}}).status, 0);
    EXPECT_EQ(run({"check"}).status, 0) << "the remedy works";
  }
  set("cloud", end, "4000000000.5");
  setAlarm("4000000000");
  EXPECT_EQ(run({"check"}).status, 0);
  write("var/hearthd/alarms.json", "[");
  EXPECT_THAT(run({"check"}).output, HasSubstr("alarms.json: line 1"));
}

TEST_F(HearthctlTest, InitKeepsWhatIsThereAndGrantsSayWhatDoesNotCount) {
  write("etc/device.json", R"({"BuildVersion": "1A1"})");
  const Outcome outcome = run({"init", "--build", "2B2"});
  EXPECT_EQ(outcome.status, 0);
  EXPECT_THAT(outcome.output, AllOf(HasSubstr("kept     " + (root / "etc/device.json").string()),
                                    HasSubstr("written  " + (root / "etc/jobs").string())));
  EXPECT_EQ(contents(root / "etc/device.json"), R"({"BuildVersion": "1A1"})");
  const std::string executable = (root / "bin/pairwellctl").string();
  EXPECT_EQ(run({"grants"}).output,
            "pairwellctl.json  " + executable + "  anyone  [\"com.kestrel.bluetooth.system\": true]\n");
  EXPECT_EQ(run({"check"}).status, 0);
  fs::permissions(executable, fs::perms(0777));
  const std::string problem = executable + " can be written by others";
  EXPECT_THAT(run({"grants", "--json"}).output, AllOf(HasSubstr("\"counts\":false"), HasSubstr(problem)));
  const Outcome checked = run({"check"});
  EXPECT_EQ(checked.status, 1);
  EXPECT_THAT(checked.output, HasSubstr(problem));
}

TEST_F(HearthctlTest, RunningDeviceIsOperated) {
  EXPECT_EQ(run({"jobs"}).status, 3);
  run({"init", "--device-name", "test"});
  start();
  EXPECT_THAT(run({"jobs"}).output, HasSubstr("com.kestrel.pairwelld  running  "));
  const std::string name = "com.kestrel.bluetooth.prefsChanged";
  const auto endless = spawn("hearthctl", {"notify", "watch", name}, "endless");
  const auto counted = spawn("hearthctl", {"notify", "watch", "other", name, "--count", "1"}, "counted");
  // A watch has begun once it prints.
  EXPECT_TRUE(eventually([&] {
    EXPECT_EQ(run({"settings", "set", "root", "key", "1"}).errors, "");
    return contents(root / "counted.out") != "" && contents(root / "endless.out") != "";
  }));
  EXPECT_TRUE(contents(root / "endless.out").ends_with(name + "\n")) << "a full buffer ends anywhere";
  ::kill(endless, SIGTERM);
  EXPECT_EQ(finish(endless, "endless").status, -1);
  const Outcome watched = finish(counted, "counted");
  EXPECT_EQ(watched.status, 0);
  EXPECT_EQ(watched.output, name + "\n");
  EXPECT_EQ(run({"notify", "watch", "never", "--count", "1", "--timeout", "0.01"}).status, 3);
  const Outcome unknown = run({"event", "com.kestrel.nobody", "x"});
  EXPECT_EQ(unknown.status, 1);
  EXPECT_THAT(unknown.errors, HasSubstr("hearthd.sock: no job consumes com.kestrel.nobody\n"));

  EXPECT_EQ(finish(spawn("pairwellctl", {"logging", "on"}, "client"), "client").status, 0);
  EXPECT_TRUE(eventually([&] { return run({"alarms"}).output != ""; }));
  EXPECT_THAT(run({"alarms"}).output,
              HasSubstr("com.kestrel.pairwelld  com.kestrel.alarm  " + flag + "  20"));
  EXPECT_EQ(run({"check"}).output, "all stores and alarms agree\n");
  EXPECT_EQ(run({"alarms", "cancel", flag, "--json"}).output, "{\"cancelled\":1}\n");
  EXPECT_EQ(run({"alarms", "cancel", flag}).status, 1);
  EXPECT_THAT(run({"check"}).output, HasSubstr("remedy: hearthctl jobs restart com.kestrel.pairwelld"));
  EXPECT_EQ(run({"jobs", "restart", "com.kestrel.pairwelld"}).status, 0);
  EXPECT_TRUE(eventually([&] { return run({"check"}).status == 0; })) << run({"check"}).output;
  EXPECT_EQ(run({"event", "com.kestrel.alarm", flag}).status, 0);
  EXPECT_TRUE(eventually([&] { return run({"settings", "get", "cloud", flag}).output == "false\n"; }));
  if (::geteuid() != 0) GTEST_SKIP() << "only root can be another user";
  EXPECT_EQ(run({"jobs", "stop", "com.kestrel.pairwelld"}, 65534).status, 4);
}

}  // namespace
