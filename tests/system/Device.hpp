// A device of real processes under a temporary root.
#pragma once

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <string>
#include <utility>

#include "platform/linux/BusClient.hpp"
#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/Paths.hpp"
#include "tests/fakes/RealFiles.hpp"

namespace processes {

namespace fs = std::filesystem;
using fakes::contents;
using fakes::eventually;
using testing::AllOf;
using testing::ElementsAre;
using testing::HasSubstr;

inline const std::string flagKey = "VelaLogCloudCollectionEnabled", endKey = flagKey + "Expiration";
inline constexpr uid_t nobody = 65534;
inline const std::string hearthdCommand = "env HEARTH_LOG_LEVEL=info HEARTH_LOG_PRIVATE=show hearthd";

struct Device : testing::Test {
  struct Outcome {
    int status;  // of the exit; the signal's, negative
    std::string output, errors;
  };

  // The programs lie in the root: a build folder may be one in which no grant counts.
  Device() {
    fs::permissions(root, fs::perms(0755));  // for clients of other users
    fs::create_directory(root / "bin");
    for (const char* program : {"hearthd", "pairwelld", "hearthctl", "pairwellctl", "cloudsyncd"})
      fs::copy_file(fs::path(PROGRAMS) / program, root / "bin" / program);
    ::setenv("HEARTH_ROOT", root.c_str(), 1);
    ::setenv("PATH", ((root / "bin").string() + ":/usr/bin:/bin").c_str(), 1);
    ::setenv("TZ", "EAST-1", 1);
  }
  ~Device() override {
    if (hearthd > 0) {
      EXPECT_EQ(stop(), 0) << log();
    }
    for (const auto& file : fs::directory_iterator(root)) {
      if (file.path().extension() != ".err") continue;
      EXPECT_EQ(contents(file.path()).find("Sanitizer"), std::string::npos) << contents(file.path());
    }
  }

  // A command of the shell; its output is appended to NAME.out, its errors to NAME.err.
  pid_t spawn(const std::string& command, const std::string& name, uid_t user = 0) {
    const pid_t pid = ::fork();
    if (pid != 0) return pid;
    const int flags = O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC;
    ::dup2(::open((root / (name + ".out")).c_str(), flags, 0600), STDOUT_FILENO);
    ::dup2(::open((root / (name + ".err")).c_str(), flags, 0600), STDERR_FILENO);
    if (user == 0 || ::setuid(user) == 0)
      ::execl("/bin/sh", "sh", "-c", ("exec " + command).c_str(), nullptr);
    ::_exit(126);
  }
  Outcome finish(pid_t pid, const std::string& name) {
    int status = 0;
    if (!eventually([&] { return ::waitpid(pid, &status, WNOHANG) == pid; })) {
      ::kill(pid, SIGKILL);
      ::waitpid(pid, &status, 0);
    }
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status), contents(root / (name + ".out")),
            contents(root / (name + ".err"))};
  }
  Outcome run(const std::string& command, uid_t user = 0) {
    for (const char* file : {"run.out", "run.err"}) fs::remove(root / file);
    return finish(spawn(command, "run", user), "run");
  }
  void write(const fs::path& path, const std::string& text) {
    fs::create_directories((root / path).parent_path());
    std::ofstream(root / path) << text;
  }

  void start() {
    const std::size_t before = timesLogged("hearthd: ready\n");
    hearthd = spawn(hearthdCommand, "hearthd");
    ASSERT_TRUE(eventually([&] { return timesLogged("hearthd: ready\n") > before; })) << log();
  }
  int stop(int signal = SIGTERM) {
    ::kill(hearthd, signal);
    return finish(std::exchange(hearthd, -1), "hearthd").status;
  }
  // What the hearthd of that root answers; an error of the connection, too.
  static platform::linux_::BusReply askHearthd(const fs::path& at, const std::string& operation,
                                               const platform::List& arguments = {}) {
    using platform::linux_::BusError;
    const std::string socket = platform::linux_::Paths::under(at).hearthdSocket();
    const auto client = platform::linux_::BusClient::connect(socket, fakes::deadline);
    if (!client) return BusError{client.error().message(), ""};
    const auto reply =
        (*client)->call(platform::linux_::hearthInterface(), operation, arguments, fakes::deadline);
    return reply ? *reply : platform::linux_::BusReply(BusError{reply.error().message(), ""});
  }
  // The daemon's process, 0 if none runs.
  pid_t pairwelld() {
    const std::string row = run("hearthctl --json jobs").output, field = "\"pid\":";
    const auto at = row.find(field);
    return at == row.npos ? 0 : std::atoi(row.c_str() + at + field.size());
  }
  // `of` is a name that spawn() was given.
  std::string log(const std::string& of = "hearthd") const { return contents(root / (of + ".err")); }
  std::size_t timesLogged(const std::string& text, const std::string& of = "hearthd") const {
    const std::string all = log(of);
    std::size_t count = 0;
    for (auto at = all.find(text); at != std::string::npos; at = all.find(text, at + 1)) ++count;
    return count;
  }
  bool logged(const std::string& text) const { return timesLogged(text) > 0; }

  const fakes::TemporaryFolder folder;
  const fs::path root = folder.path;
  pid_t hearthd = -1;
};

}  // namespace processes
