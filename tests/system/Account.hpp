// Devices of one account, real processes.
#pragma once

#include <functional>
#include <map>
#include <string>

#include "tests/system/Device.hpp"

namespace processes {

// Each device is a folder below the root, the programs lie in the root itself.
struct Account : Device {
  ~Account() override { stopAll(); }

  Outcome join(const std::string& name, const std::string& at, const std::string& options = "") {
    return on(name, "hearthctl", "init --cloud '" + at + "' --account home " + options);
  }
  Outcome on(const std::string& name, const std::string& program, const std::string& arguments) {
    return run(program + " --root " + (root / name).string() + " " + arguments);
  }
  Outcome cloud(const std::string& name, const std::string& arguments) {
    return on(name, "hearthctl", "cloud " + arguments);
  }

  pid_t spawnHearthd(const std::string& name) {
    return running[name] = spawn(hearthdCommand + (" --root " + (root / name).string()), name);
  }
  void start(const std::string& name) {
    spawnHearthd(name);
    ASSERT_TRUE(eventually([&] { return on(name, "pairwellctl", "status").status == 0; })) << log(name);
    ASSERT_TRUE(comesToSay(name, "connected          "));
  }
  int stop(const std::string& name, int signal = SIGTERM) {
    const pid_t pid = running[name];
    running.erase(name);
    ::kill(pid, signal);
    return finish(pid, name).status;
  }
  void stopAll() {
    for (const auto& entry : std::map(running)) EXPECT_EQ(stop(entry.first), 0) << log(entry.first);
  }
  testing::AssertionResult comesToSay(const std::string& name, const std::string& text) {
    if (eventually([&] { return cloud(name, "status").output.find(text) != std::string::npos; }))
      return testing::AssertionSuccess();
    return testing::AssertionFailure() << cloud(name, "status").output << log(name);
  }

  void switchTo(const std::string& name, const std::string& state) {
    EXPECT_EQ(on(name, "pairwellctl", "logging " + state).status, 0);
  }
  std::string setting(const std::string& name, const std::string& key) {
    return on(name, "hearthctl", "settings get cloud " + key).output;
  }
  // Whether the device comes to be on, its stores as well as what it answers, until the end that the other
  // has.
  testing::AssertionResult followsOn(const std::string& name, const std::string& other) {
    return comesTo(name, [&] {
      return on(name, "pairwellctl", "logging").output.starts_with("on until ") &&
             on(name, "hearthctl", "alarms").output.find(flagKey) != std::string::npos &&
             setting(other, endKey) != "" && setting(name, endKey) == setting(other, endKey);
    });
  }
  testing::AssertionResult followsOff(const std::string& name) {
    return comesTo(name, [&] {
      return on(name, "pairwellctl", "logging").output == "off\n" && setting(name, endKey) == "" &&
             on(name, "hearthctl", "alarms").output == "";
    });
  }
  testing::AssertionResult comesTo(const std::string& name, const std::function<bool()>& condition) {
    if (eventually(condition)) return testing::AssertionSuccess();
    return testing::AssertionFailure() << log(name);
  }

  std::map<std::string, pid_t> running;
};

}  // namespace processes
