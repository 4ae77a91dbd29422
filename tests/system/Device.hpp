// A device of real processes under a temporary root.
#pragma once

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>
#include <thread>

#include "platform/linux/Json.hpp"
#include "platform/linux/Paths.hpp"

namespace pairwell_system {

namespace fs = std::filesystem;
using testing::HasSubstr;
using testing::StartsWith;

inline constexpr const char* flagKey = "VelaLogCloudCollectionEnabled";
inline constexpr const char* endKey = "VelaLogCloudCollectionEnabledExpiration";
inline constexpr const char* overrideKey = "VelaLogCloudCollectionExpirationIntervalOverride";

// Generous: the machine may be busy. A condition that holds is noticed at once.
inline bool eventually(const std::function<bool()>& condition) {
  const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(30);
  while (!condition()) {
    if (std::chrono::steady_clock::now() > end) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  return true;
}

inline std::string contents(const fs::path& path) {
  std::ostringstream text;
  text << std::ifstream(path).rdbuf();
  return text.str();
}

class Device : public testing::Test {
 protected:
  struct Run {
    int status;
    std::string output;
    std::string errors;
  };

  Device() {
    std::string name = (fs::temp_directory_path() / "pairwellXXXXXX").string();
    root = ::mkdtemp(name.data());
    fs::create_directory(root / "bin");
    for (const char* program : {"hearthd", "pairwelld", "hearthctl", "pairwellctl"})
      fs::copy_file(fs::path(PROGRAMS) / program, root / "bin" / program);
    fs::copy_file(fs::path(PROGRAMS) / "pairwellctl", root / "bin/stranger");
    EXPECT_EQ(run("hearthctl init --internal").status, 0);
  }
  ~Device() override {
    if (hearthd > 0) {
      stop();
      EXPECT_EQ(status, 0) << log();
    }
    EXPECT_EQ(log().find("Sanitizer"), std::string::npos) << log();
    fs::remove_all(root);
  }

  // One of the root's programs with its arguments.
  Run run(const std::string& commandLine) {
    const auto space = commandLine.find(' ');
    const std::string command = (root / "bin").string() + "/" + commandLine.substr(0, space) + " --root " +
                                root.string() + commandLine.substr(std::min(space, commandLine.size())) +
                                " >" + (root / "out").string() + " 2>" + (root / "err").string();
    const int result = std::system(command.c_str());
    return {WIFEXITED(result) ? WEXITSTATUS(result) : -1, contents(root / "out"), contents(root / "err")};
  }
  std::string setting(const std::string& source, const std::string& key) {
    const Run got = run("hearthctl settings get " + source + " " + key);
    return got.status == 0 ? got.output.substr(0, got.output.find('\n')) : "";
  }

  // Returns once the client service answers.
  void start() {
    hearthd = ::fork();
    if (hearthd == 0) {
      const int file = ::open((root / "log").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
      ::dup2(file, STDERR_FILENO);
      ::setenv("HEARTH_LOG_PRIVATE", "show", 1);
      const std::string program = (root / "bin/hearthd").string();
      ::execl(program.c_str(), "hearthd", "--root", root.c_str(), nullptr);
      ::_exit(126);
    }
    ASSERT_TRUE(eventually([&] { return run("pairwellctl status").status == 0; })) << log();
  }
  void stop(int signal = SIGTERM) {
    ::kill(hearthd, signal);
    ::waitpid(hearthd, &status, 0);
    hearthd = -1;
  }
  // The running daemon's process, 0 if none runs.
  pid_t pairwelld() {
    std::string problem;
    const auto row = platform::linux_::parseJson(run("hearthctl --json jobs").output, problem);
    if (!row) return 0;
    const auto& fields = *row->as<platform::Dictionary>();
    return static_cast<pid_t>(*platform::toInteger(fields.at("pid")));
  }
  bool restartedAfter(pid_t former) {
    return eventually([&] {
      const pid_t now = pairwelld();
      return now > 0 && now != former && run("pairwellctl status").status == 0;
    });
  }

  std::string log() const { return contents(root / "log"); }
  bool logged(const std::string& text) const { return log().find(text) != std::string::npos; }
  std::size_t timesLogged(const std::string& text) const {
    const std::string all = log();
    std::size_t count = 0;
    for (auto at = all.find(text); at != std::string::npos; at = all.find(text, at + 1)) ++count;
    return count;
  }
  bool isOn() { return run("pairwellctl logging").output.starts_with("on"); }
  bool isAllOff() {
    return setting("root", flagKey) != "true" && setting("cloud", flagKey) != "true" &&
           setting("cloud", endKey).empty() &&
           run("hearthctl alarms").output.find(flagKey) == std::string::npos;
  }

  fs::path root;
  pid_t hearthd = -1;
  int status = 0;
};

}  // namespace pairwell_system
