// Each system call that a device's programs make for its files, alarms and jobs fails once, in turn, in each
// way that it can. Every 37th call is, fewer with sanitizers; or with FAULT_STRIDE=1 each.
#include <sys/mman.h>

#include <algorithm>
#include <cstring>
#include <iostream>
#include <sstream>

#include "tests/system/Account.hpp"
#include "tests/system/Faults.hpp"

namespace processes {
namespace {

using faults::Kind;

#ifndef STRIDE
#define STRIDE 37
#endif

struct FaultTest : Account {
  FaultTest() {
    fs::create_directory(root / "share");
    write("faults", std::string(sizeof(faults::Control), '\0'));
    const platform::linux_::UniqueDescriptor file(::open((root / "faults").c_str(), O_RDWR | O_CLOEXEC));
    void* page = ::mmap(nullptr, sizeof(faults::Control), PROT_READ | PROT_WRITE, MAP_SHARED, file.get(), 0);
    EXPECT_NE(page, MAP_FAILED);
    control = static_cast<faults::Control*>(page);
  }
  ~FaultTest() override {
    ::unsetenv("LD_PRELOAD");
    stopAll();
    ::munmap(control, sizeof *control);
  }

  std::string url() const {
    return "dir:" + (root / "share").string() + (std::getenv("FAULT_STRIDE") ? "" : "?poll=0.2");
  }
  void preload(const std::string& name) {
    ASSERT_EQ(join(name, url()).status, 0);
    ::setenv("FAULTS", (root / "faults").c_str(), 1);
    for (const auto& entry : fs::directory_iterator(root / name / "etc/jobs")) {
      const std::string fields = contents(entry.path());
      std::ofstream(entry.path()) << R"({"environment": {"LD_PRELOAD": ")" FAULTS R"(", "FAULTS": ")"
                                  << (root / "faults").string() << "\"}," << fields.substr(1);
    }
    ::setenv("LD_PRELOAD", FAULTS, 1);
  }

  void arm(const std::string& program, Kind kind, int call) {
    control->failAt = 0;
    control->failed[0] = '\0';
    program.copy(control->program, sizeof control->program - 1);
    control->program[program.size()] = '\0';
    control->kind = kind;
    control->calls = 0;
    control->failAt = call;
    armedAt = log("one").size();
  }
  bool hasFailed() const { return control->calls >= control->failAt; }
  // What the platform says of it.
  std::vector<std::string> said() const {
    std::istringstream lines(log("one").substr(armedAt));
    std::vector<std::string> found;
    for (std::string line; std::getline(lines, line);) {
      if (line.find(" error com.kestrel.hearth:") != line.npos) found.push_back(line);
    }
    return found;
  }

  // Runs `act` until it has seen every call of `program` fail in every way.
  void failEach(const std::string& program, const std::function<void()>& act) {
    const char* variable = std::getenv("FAULT_STRIDE");
    const int stride = variable ? std::atoi(variable) : STRIDE;
    for (const Kind kind :
         {faults::full, faults::broken, faults::interrupted, faults::noDescriptor, faults::partial}) {
      bool failed = true;
      for (int call = variable ? 1 : 1 + kind % 5; failed; call += stride) {
        arm(program, kind, call);
        act();
        failed = hasFailed();
        control->failAt = 0;
        SCOPED_TRACE(testing::Message()
                     << "call " << call << " of " << program << ": " << control->failed << ", kind " << kind);
        checkSaid(kind);
        repair();
        if (variable && failed)
          std::cout << kind << " " << call << " " << control->failed << ": " << testing::PrintToString(said())
                    << "\n";
        ASSERT_FALSE(HasFailure()) << log("one").substr(armedAt);
      }
    }
  }
  // Once; that a job is started again is said beside it, and by a job that loses its link, each call that was
  // under way.
  void checkSaid(Kind kind) {
    const auto lines = said();
    const auto causes = std::count_if(lines.begin(), lines.end(), [](const std::string& line) {
      return line.find("; next start in ") == line.npos && line.find("com.kestrel.hearth:link ") == line.npos;
    });
    EXPECT_LE(causes, 1);
    EXPECT_TRUE((kind != faults::interrupted && kind != faults::partial) || lines.empty());
  }

  Outcome ctl(const std::string& arguments) { return on("one", "hearthctl", arguments); }
  std::string logging() { return on("one", "pairwellctl", "logging").output; }
  bool isOn() { return logging().starts_with("on"); }
  bool isWholly(bool enabled) {
    const std::string answer = logging();
    return (enabled ? answer.starts_with("on until ") : answer == "off\n") && ctl("check").status == 0;
  }
  // Everything says so; or what is stored is what is answered, once somebody has said what failed.
  testing::AssertionResult comesTo(bool enabled) {
    return Account::comesTo("one", [&] {
      return isWholly(enabled) || (!said().empty() && isOn() == (setting("one", flagKey) == "true\n"));
    });
  }
  testing::AssertionResult comesToBeWholly(bool enabled) {
    const auto result = Account::comesTo("one", [&] { return isWholly(enabled); });
    return result ? result : testing::AssertionFailure() << ctl("check").output;
  }
  // The device works, and hears of what others write.
  void repair() {
    // Again where it takes up an end that was left, and passes.
    EXPECT_TRUE(Account::comesTo("one", [&] {
      switchTo("one", "on");
      return isWholly(true);
    })) << ctl("check").output;
    EXPECT_EQ(ctl("settings set cloud " + flagKey + " false").status, 0);
    EXPECT_TRUE(comesToBeWholly(false));
  }
  // Counted from now on, not from the beginning of the act.
  void armAgain(int call) {
    control->calls = 0;
    control->failAt = call;
  }

  faults::Control* control;
  std::size_t armedAt = 0;
};

struct FaultOf : FaultTest, testing::WithParamInterface<const char*> {
  FaultOf() {
    preload("one");
    start("one");
  }
};

TEST_P(FaultOf, SwitchIsWholeOrSaidAndTheNextOneWorks) {
  failEach(GetParam(), [&] {
    for (const bool enabled : {true, false}) {
      switchTo("one", enabled ? "on" : "off");
      EXPECT_TRUE(comesTo(enabled));
    }
  });
}

TEST_P(FaultOf, RestartKeepsThePeriod) {
  failEach(GetParam(), [&] {
    const int call = control->failAt.exchange(0);
    switchTo("one", "on");
    EXPECT_TRUE(comesToBeWholly(true));
    const std::string end = setting("one", endKey);
    armAgain(call);
    EXPECT_EQ(ctl("jobs restart com.kestrel.pairwelld").status, 0);
    EXPECT_TRUE(comesTo(true));
    EXPECT_TRUE(isOn());
    EXPECT_EQ(setting("one", endKey), end);
  });
}

TEST_P(FaultOf, PeriodEndsThoughNobodyLooks) {
  const std::string interval = " VelaLogCloudCollectionExpirationIntervalOverride";
  failEach(GetParam(), [&] {
    EXPECT_EQ(ctl("settings set user" + interval + " 1").status, 0);
    switchTo("one", "on");
    EXPECT_TRUE(Account::comesTo(
        "one", [&] { return log("one").find("Stop Audio Accessory", armedAt) != std::string::npos; }));
    EXPECT_TRUE(comesTo(false));
    EXPECT_EQ(ctl("settings unset user" + interval).status, 0);
  });
}

TEST_F(FaultTest, OthersSettingIsFollowedOrItsFailureSaid) {
  preload("one");
  start("one");
  for (const char* program : {"pairwelld", "hearthctl"}) {
    failEach(program, [&] {
      for (const bool enabled : {true, false}) {
        const Outcome set = ctl("settings set cloud " + flagKey + (enabled ? " true" : " false"));
        EXPECT_EQ(set.status == 0, set.errors.empty()) << set.errors;
        EXPECT_TRUE(set.status != 0 || comesTo(enabled));
      }
    });
  }
}

TEST_F(FaultTest, StartOfHearthdServesOrEndsAndSaysWhy) {
  preload("one");
  start("one");
  failEach("hearthd", [&] {
    const int call = control->failAt.exchange(0);
    switchTo("one", "on");
    EXPECT_TRUE(comesToBeWholly(true));
    const std::string end = setting("one", endKey);
    EXPECT_EQ(stop("one"), 0);
    armAgain(call);
    const pid_t pid = spawnHearthd("one");
    bool hasEnded = false, isSkipped = false;
    EXPECT_TRUE(Account::comesTo("one", [&] {
      hasEnded = ::waitpid(pid, nullptr, WNOHANG) == pid;
      isSkipped = log("one").find(" is skipped", armedAt) != std::string::npos;
      return hasEnded || isSkipped || on("one", "pairwellctl", "status").status == 0;
    }));
    if (isSkipped) {
      EXPECT_EQ(stop("one"), 0);
    }
    if (hasEnded || isSkipped) {
      EXPECT_TRUE(hasFailed());
      EXPECT_THAT(log("one").substr(armedAt), HasSubstr(::strerror(faults::errorOf(control->kind))));
      running.erase("one");
      start("one");
    }
    EXPECT_TRUE(comesTo(true));
    EXPECT_TRUE(isOn());
    EXPECT_EQ(setting("one", endKey), end);
  });
}

TEST_F(FaultTest, DevicesOfAnAccountComeToAgree) {
  fakes::deadline = std::chrono::seconds(100);  // what could not be read is read again after 30 s
  ASSERT_EQ(join("two", url()).status, 0);
  preload("one");
  for (const char* name : {"one", "two"}) start(name);
  // What "one" has written last has reached "two".
  auto catchUp = [&, round = 0]() mutable {
    const std::string value = std::to_string(++round);
    EXPECT_EQ(ctl("settings set cloud round " + value).status, 0);
    EXPECT_TRUE(Account::comesTo("one", [&] { return setting("two", "round") == value + "\n"; }));
    EXPECT_TRUE(followsOff("two"));
  };
  failEach("cloudsyncd", [&] {
    catchUp();
    switchTo("one", "on");
    EXPECT_TRUE(followsOn("two", "one"));
    switchTo("two", "off");
    EXPECT_TRUE(followsOff("one"));
    EXPECT_TRUE(comesToSay("one", "waiting to go out  nothing"));
  });
  failEach("cloudsyncd", [&] {
    catchUp();
    EXPECT_EQ(ctl("jobs restart com.kestrel.cloudsyncd").status, 0);
    switchTo("two", "on");
    EXPECT_TRUE(followsOn("one", "two"));
    switchTo("two", "off");
    EXPECT_TRUE(followsOff("one"));
  });
  fakes::deadline = std::chrono::seconds(30);
}

INSTANTIATE_TEST_SUITE_P(Programs, FaultOf, testing::Values("pairwelld", "hearthd"));

}  // namespace
}  // namespace processes
