// Kills at random moments, and processes that stand still, under clients' load.
#include <algorithm>
#include <cmath>
#include <iostream>
#include <optional>
#include <random>
#include <set>

#include "hearthd/ProcessHandle.hpp"
#include "pairwelld/Names.hpp"
#include "platform/linux/LinuxFileSystem.hpp"
#include "tests/system/Account.hpp"
#include "tools/StoredSettings.hpp"

namespace processes {
namespace {

using platform::List;
using platform::linux_::Paths;

constexpr double shortPeriod = 1.2, longPeriod = 1000;
const std::string names[] = {"one", "two"};
// All that `check` may find at rest; the last is the account's, as a device that is on keeps its alarm.
const std::string residueKinds[] = {"the root flag is on, and the cloud flag off",
                                    "an end time is left with the flag off",
                                    "an alarm is left with the flag off", "is not at the end"};

int fromEnvironment(const char* name, int otherwise) {
  const char* value = std::getenv(name);
  return value ? std::atoi(value) : otherwise;
}

double now() {
  return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

struct Period {
  bool isOn = false;
  double end = 0;
  bool operator==(const Period&) const = default;
};

struct KillTest : Account {
  KillTest() {
    fs::create_directory(root / "share");
    for (const auto& name : names) {
      EXPECT_EQ(join(name, "dir:" + (root / "share").string()).status, 0);
      write(name + "/etc/jobs/alarms.json", R"({"name": "alarms", "program": ")" PROGRAMS
                                            R"(/alarm_job", "streams": ["com.kestrel.alarm"]})");
      start(name);
    }
    setPeriod(longPeriod);
  }
  void setPeriod(double seconds) {
    const std::string key = "VelaLogCloudCollectionExpirationIntervalOverride ";
    for (const auto& name : names)
      EXPECT_EQ(on(name, "hearthctl", "settings set user " + key + std::to_string(seconds)).status, 0);
  }

  // What hearthd answers; absent while there is none.
  std::optional<List> ask(const std::string& name, const std::string& operation, const List& arguments = {}) {
    const auto reply = askHearthd(root / name, operation, arguments);
    const auto* results = std::get_if<List>(&reply);
    return results ? std::optional(*results) : std::nullopt;
  }
  // 0 while it does not run.
  pid_t processOf(const std::string& name, const std::string& program) {
    const auto jobs = ask(name, "ListJobs");
    for (const auto& row : jobs ? *(*jobs)[0].as<List>() : List()) {
      const List& job = *row.as<List>();
      if (*job[0].as<std::string>() == "com.kestrel." + program)
        return static_cast<pid_t>(*job[2].as<std::int64_t>());
    }
    return 0;
  }

  platform::Dictionary cloudOf(const std::string& name) {
    std::string problem;
    const auto found =
        tools::storedValues(files, Paths::under(root / name), pairwell::KeyValueSource::cloud, problem);
    EXPECT_EQ(problem, "") << name;
    return found ? *found : platform::Dictionary();
  }
  Period stored(const std::string& name) {
    const auto cloud = cloudOf(name);
    const auto* flag = platform::find<bool>(cloud, flagKey);
    return {flag && *flag, tools::endIn(cloud).value_or(0)};
  }
  // The last number that a device's load was told is stored; whether the store of `place` has it.
  int acknowledged(const std::string& name) { return std::atoi(contents(root / name / "count").c_str()); }
  bool hasCount(const std::string& place, const std::string& name) {
    const auto last = acknowledged(name);
    const auto cloud = cloudOf(place);
    const auto* count = platform::find<std::int64_t>(cloud, "count-" + name);
    return last == 0 || (count && *count >= last);
  }

  // Nothing comes before its time.
  void observe() {
    for (const auto& name : names) {
      std::ifstream events(root / name / "events");
      for (std::string stream, date; events >> stream >> date;) {
        if (!fired.insert(name + " " + date).second) continue;
        EXPECT_LE(std::atof(date.c_str()) / 1e9, now()) << "an alarm is early";
      }
    }
    if (!promised.isOn || stored(promiser).isOn) return;
    EXPECT_GE(now(), std::floor(promised.end)) << "a period has ended early";
  }
  double upTo(double seconds) { return seconds * static_cast<double>(random() % 1000) / 1000; }
  // The moment of a kill is what varies: no condition has to be met.
  void pauseUpTo(
      double seconds, const std::function<bool()>& isEnough = [] { return false; }) {
    for (const double end = now() + upTo(seconds); now() < end && !isEnough();) {
      observe();
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
  }

  bool killJob(const std::string& name, const std::string& program) {
    const pid_t pid = processOf(name, program);
    const auto process = hearth::openProcess(pid);
    std::error_code gone;
    const auto executable = fs::read_symlink("/proc/" + std::to_string(pid) + "/exe", gone);
    if (!process || executable != root / "bin" / program) return false;  // the number is another's by now
    ask(name, "ControlJob", {"start", "com.kestrel." + program});        // takes back the growing delay
    if (hearth::signalProcess(process, SIGKILL) < 0) return false;
    ++killed[name + " " + program];
    return eventually([&] { return processOf(name, program) != pid; });
  }
  void killNext(const std::string& name) {
    const std::string program = victims.back();
    victims.pop_back();
    if (victims.size() % 300 == 0) std::cout << victims.size() << " kills to go" << std::endl;
    if (program != "hearthd") {
      EXPECT_TRUE(eventually([&] { return killJob(name, program); })) << log(name);
      return;
    }
    stop(name, SIGKILL);
    ++killed[name + " hearthd"];
    pauseUpTo(0.02);
    spawnHearthd(name);
  }
  int cutsOf(const std::string& name) { return killed[name + " pairwelld"] + killed[name + " hearthd"]; }

  // The devices come to rest, alike, with residues of the known kinds alone; these are counted, and mended as
  // `check` advises. Only a cut leaves any.
  void settle(bool isCut) {
    std::string problems;
    mended = 0;
    EXPECT_TRUE(eventually([&] {
      observe();
      period = stored("one");
      if (period != stored("two")) return false;
      problems.clear();
      const auto rests = [&](const std::string& name) {
        return on(name, "pairwellctl", "logging").output.starts_with(period.isOn ? "on" : "off") &&
               isMended(name, problems) && period == stored(name);
      };
      return std::all_of(std::begin(names), std::end(names), rests);
    })) << problems
        << log("one") << log("two");
    EXPECT_TRUE(isCut || mended == 0) << mended << " residues though nothing was cut";
    for (const auto& name : names) EXPECT_TRUE(hasCount(name, name)) << "an acknowledged write is lost";
  }
  // Whether there was nothing to mend. What is not found again was only under way on a busy machine.
  bool isMended(const std::string& name, std::string& problems) {
    const Outcome check = on(name, "hearthctl", "check");
    const bool isAgain = std::exchange(lastFindings[name], check.output) == check.output;
    std::istringstream lines(check.output);
    const std::string command = "    remedy: hearthctl ";
    for (std::string problem, remedy; std::getline(lines, problem) && std::getline(lines, remedy);) {
      problems += problem + "\n";
      const auto kind = std::find_if(std::begin(residueKinds), std::end(residueKinds),
                                     [&](const auto& text) { return problem.find(text) != problem.npos; });
      if (kind == std::end(residueKinds) || !isAgain) continue;
      ++mended;
      ++residues[*kind];
      on(name, "hearthctl", remedy.substr(command.size()));
      if (remedy.find("jobs restart") != remedy.npos) ++killed[name + " pairwelld"];
    }
    return check.status == 0;
  }

  // `callTime` is what a client's call takes.
  void killAroundASwitch(double callTime) {
    const Period before = period;
    const std::string device = names[random() % 2];
    const bool switches = random() % 3 > 0;
    const double begin = now();
    const int cuts = cutsOf(device), allCuts = cutsOf("one") + cutsOf("two");
    const auto listener =
        platform::linux_::BusClient::connect(Paths::under(root / device).hearthdSocket(), fakes::deadline);
    ASSERT_TRUE(listener) << listener.error().message();
    EXPECT_TRUE((*listener)->call(platform::linux_::hearthInterface(), "Watch",
                                  {std::string(pairwell::names::settingsChanged)}, fakes::deadline));
    bool isAnnounced = false;
    // Whoever was started anew announces what it finds, not the switch.
    const auto hears = [&] {
      if (cutsOf(device) > cuts) return false;
      const auto signal = (*listener)->nextSignal(std::chrono::milliseconds(0));
      const bool isHeard = signal && *signal;
      isAnnounced |= isHeard;
      return isHeard;
    };
    const std::string command = "pairwellctl --root " + (root / device).string() + " logging ";
    const pid_t client = switches ? spawn(command + (before.isOn ? "off" : "on"), "client") : 0;
    if (switches && random() % 2 > 0) {
      EXPECT_TRUE(eventually([&] { return observe(), hears(); })) << "a switch is not announced";
    }
    for (auto left = std::min(victims.size(), 1 + random() % 3); left > 0; --left) {
      pauseUpTo(1.5 * callTime, hears);
      killNext(random() % 4 > 0 ? device : names[random() % 2]);
    }
    const int status = switches ? finish(client, "client").status : 3;
    EXPECT_TRUE(status == 0 || status == 3) << status;
    const bool isCut = cutsOf(device) > cuts;
    settle(cutsOf("one") + cutsOf("two") > allCuts);
    switched += switches;
    inForce += period != before;
    announced += isAnnounced;
    if (period == before) {
      EXPECT_TRUE(status != 0 || isCut) << "a switch is lost, and nothing that carries it was killed";
      EXPECT_FALSE(isAnnounced) << "a switch is lost that was announced";
    } else {
      EXPECT_TRUE(switches && period.isOn != before.isOn) << "an acknowledged switch is lost";
      EXPECT_TRUE(!period.isOn || (period.end > begin + longPeriod && period.end < now() + longPeriod));
    }
  }
  // Nobody reads whether logging is on until the period is over: its alarm or a start ends it.
  void killThroughAPeriod() {
    EXPECT_EQ(on("one", "pairwellctl", "logging off").status, 0);
    settle(false);
    setPeriod(shortPeriod);
    promiser = names[random() % 2];
    const double begin = now();
    switchTo(promiser, "on");
    Period seen;
    EXPECT_TRUE(eventually([&] {
      seen = stored(promiser);
      return (seen.isOn && seen.end > 0) || now() > begin + shortPeriod;  // too busy to look in time
    })) << log(promiser);
    promised = seen;
    const auto count = std::min(victims.size(), 3 + random() % 4);
    for (auto left = count; left > 0; --left) {
      pauseUpTo(2 * (shortPeriod + 0.5) / static_cast<double>(count));
      killNext(names[random() % 2]);
    }
    const double due = std::max(now(), promised.end);
    EXPECT_TRUE(eventually([&] {
      observe();
      return !stored("one").isOn && !stored("two").isOn;
    })) << "a period outlives its end"
        << log("one") << log("two");
    longestOverrun = std::max(longestOverrun, now() - due);
    promised = {};
    setPeriod(longPeriod);
    settle(true);
    EXPECT_FALSE(period.isOn);
  }

  // No more starts than kills, no other ends, one first launch.
  void judgeLog(const std::string& name) {
    const int starts = 1 + killed[name + " hearthd"];
    for (const std::string program : {"pairwelld", "cloudsyncd"}) {
      const int kills = killed[name + " " + program];
      const auto started = timesLogged("com.kestrel." + program + " started as process", name);
      EXPECT_LE(started, static_cast<std::size_t>(starts + kills)) << program;
      std::cout << name << ": hearthd started " << starts << " times, " << program << " " << started
                << ", killed " << kills << "\n";
    }
    EXPECT_EQ(timesLogged("ended by signal ", name), timesLogged("ended by signal 9", name));
    EXPECT_EQ(timesLogged("This is the first run since reboot", name), 1u);
    EXPECT_EQ(on(name, "hearthctl", "settings get user LastOSLaunchVersion").output, "21A5248v\n");
    for (const char* text : {"Sanitizer", "exited with status", "moved to", "publishes under this device's",
                             "were dropped", "is refused"})
      EXPECT_EQ(timesLogged(text, name), 0u) << text;
  }

  platform::linux_::LinuxFileSystem files{nullptr};
  std::mt19937 random;
  std::vector<std::string> victims;
  Period period;    // of both at rest
  Period promised;  // seen stored, on `promiser`
  std::string promiser;
  std::set<std::string> alarms, fired;  // device and date
  std::map<std::string, int> killed, residues;
  std::map<std::string, std::string> lastFindings;
  int switched = 0, inForce = 0, announced = 0, mended = 0;
  double longestOverrun = 0;
};

TEST_F(KillTest, KillsAtRandomMomentsLoseNothing) {
  const int seed = fromEnvironment("KILL_SEED", 1), count = fromEnvironment("KILLS", 30);
  std::cout << "seed " << seed << ", " << count << " kills of each" << std::endl;
  random.seed(static_cast<std::mt19937::result_type>(seed));
  for (int each = 0; each < count; ++each)
    victims.insert(victims.end(), {"pairwelld", "hearthd", "cloudsyncd"});
  std::shuffle(victims.begin(), victims.end(), random);
  write("load.sh",
        "cd $HEARTH_ROOT; while [ ! -e enough ]; do n=$((n + 1)); pairwellctl --root $1 given-name\n"
        "hearthctl --root $1 settings set cloud count-$1 $n && echo $n > $1/count; sleep 0.05; done");
  std::map<std::string, pid_t> loads;
  for (const auto& name : names)
    loads[name] = spawn("sh " + (root / "load.sh").string() + " " + name, "load-" + name);
  const double begin = now();
  settle(false);
  const double callTime = (now() - begin) / 4;  // it has made as many
  while (!victims.empty() && !HasFailure()) {
    for (const auto& name : names) {
      const auto date = static_cast<std::int64_t>((now() + 0.05 + upTo(1.5)) * 1e9);
      const std::string text = std::to_string(date);
      if (ask(name, "SetEvent", {"com.kestrel.alarm", text, date})) alarms.insert(name + " " + text);
    }
    random() % 5 == 0 ? killThroughAPeriod() : killAroundASwitch(callTime);
  }
  write("enough", "");
  for (const auto& name : names) EXPECT_EQ(finish(loads[name], "load-" + name).status, 0);
  EXPECT_TRUE(eventually([&] {
    observe();
    return std::includes(fired.begin(), fired.end(), alarms.begin(), alarms.end());
  })) << "an alarm is lost";
  EXPECT_TRUE(eventually([&] { return hasCount("one", "two") && hasCount("two", "one"); }))
      << "a write is lost";
  settle(false);
  for (const auto& name : names) judgeLog(name);
  std::cout << switched << " switches, " << inForce << " in force, " << announced << " announced; "
            << acknowledged("one") + acknowledged("two") << " writes and " << alarms.size()
            << " alarms acknowledged\n";
  for (const auto& kind : residueKinds) std::cout << residues[kind] << " times: " << kind << "\n";
  std::cout << "longest overrun " << longestOverrun << " s" << std::endl;
}

// For STOP_SECONDS each, at least.
TEST_F(KillTest, ProcessesThatStandStillGoOnAsIfNothingHadBeen) {
  const int span = fromEnvironment("STOP_SECONDS", 0);
  const auto whileStopped = [&](pid_t process, const std::function<void()>& check) {
    const double begin = now();
    EXPECT_EQ(::kill(process, SIGSTOP), 0);
    check();
    while (now() < begin + span) pauseUpTo(1);
    EXPECT_EQ(::kill(process, SIGCONT), 0);
  };
  setPeriod(shortPeriod + 1);
  switchTo("one", "on");
  ASSERT_TRUE(followsOn("two", "one"));
  whileStopped(running["one"], [&] {
    EXPECT_EQ(on("one", "pairwellctl", "given-name").status, 0) << "clients need no hearthd";
    EXPECT_TRUE(followsOff("two")) << "by its own alarm";
  });
  for (const auto& name : names) EXPECT_TRUE(followsOff(name));
  setPeriod(longPeriod);
  const pid_t pairwelld = processOf("one", "pairwelld"), cloudsyncd = processOf("one", "cloudsyncd");
  whileStopped(pairwelld, [&] {
    EXPECT_EQ(on("one", "pairwellctl", "--timeout 0.5 logging").status, 3);
    switchTo("two", "on");
    EXPECT_TRUE(comesTo("one", [&] { return stored("one").isOn; }));
  });
  EXPECT_TRUE(followsOn("one", "two"));
  // The kernel moves an absolute timer of the wall clock when that is set; no test may set the machine's.
  const std::string timers = run("cat /proc/" + std::to_string(running["one"]) + "/fdinfo/*").output;
  EXPECT_THAT(timers, testing::ContainsRegex("clockid: 0\nticks: 0\nsettime flags: 01\nit_value: .[1-9]"));
  whileStopped(cloudsyncd, [&] {
    switchTo("one", "off");
    EXPECT_TRUE(comesTo("one", [&] { return !stored("one").isOn; }));
  });
  for (const auto& name : names) EXPECT_TRUE(followsOff(name));
  EXPECT_EQ(processOf("one", "pairwelld"), pairwelld) << "nobody starts another";
  EXPECT_EQ(processOf("one", "cloudsyncd"), cloudsyncd);
  for (const auto& name : names) EXPECT_EQ(on(name, "hearthctl", "check").status, 0);
}

}  // namespace
}  // namespace processes
