// hearthd [--root DIR]: the service manager, in the foreground.
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <system_error>

#include "hearthd/ServiceManager.hpp"
#include "platform/LogSink.hpp"
#include "platform/linux/EventLoop.hpp"
#include "platform/linux/LinuxFileSystem.hpp"
#include "platform/linux/Paths.hpp"
#include "platform/linux/ProcessLock.hpp"
#include "platform/linux/ProcessSetup.hpp"
#include "platform/linux/UnifiedLog.hpp"

namespace {

using platform::linux_::UniqueDescriptor;

constexpr int failed = 1;
constexpr int wrongUsage = 2;
constexpr const char* usage = "usage: hearthd [--root DIR]";

// Empty for the system's folders.
std::optional<std::string> rootFromArguments(int count, char** arguments) {
  std::string root;
  if (const char* variable = std::getenv("HEARTH_ROOT")) root = variable;
  for (int index = 1; index < count; ++index) {
    const std::string_view argument = arguments[index];
    if (argument == "--root" && index + 1 < count) {
      root = arguments[++index];
    } else if (argument.starts_with("--root=")) {
      root = argument.substr(7);
    } else {
      return std::nullopt;
    }
  }
  return root;
}

// Never waits: whoever holds the other end may not read.
void say(const std::string& text) {
  pollfd standardError{STDERR_FILENO, POLLOUT, 0};
  if (::poll(&standardError, 1, 0) <= 0) return;
  [[maybe_unused]] const ssize_t written = ::write(STDERR_FILENO, text.data(), text.size());
}

// What is opened must not take the place of a closed standard descriptor, to which messages go.
void openStandardDescriptors() {
  int descriptor = 0;
  while (descriptor >= 0 && descriptor <= STDERR_FILENO) descriptor = ::open("/dev/null", O_RDWR);
  ::close(descriptor);
}

void prepareProcess() {
  openStandardDescriptors();
  ::umask(022);
  platform::linux_::prepareSignals();
  platform::linux_::raiseDescriptorLimit();
}

// The lock that says that a hearthd lives on this root.
std::optional<UniqueDescriptor> takeRoot(const platform::linux_::Paths& paths) {
  std::error_code error;
  if (std::filesystem::create_directories(paths.run, error); error) {
    say("hearthd: " + paths.run + ": " + error.message() + "\n");
    return std::nullopt;
  }
  const std::string path = paths.run + "/hearthd.lock";
  auto lock = platform::linux_::takeLock(path);
  if (!lock) {
    say("hearthd: " + path + ": " + lock.error().message() + "\n");
    return std::nullopt;
  }
  if (!*lock) {
    say("hearthd: already running\n");
    return std::nullopt;
  }
  return std::move(*lock);
}

void announceReady() {
  say("hearthd: ready\n");
  sd_notify(0, "READY=1");
}

}  // namespace

int main(int count, char** arguments) {
  for (const char* help : {"--help", "-h"}) {
    if (count == 2 && std::string_view(arguments[1]) == help) return std::puts(usage), 0;
  }
  const auto root = rootFromArguments(count, arguments);
  if (!root) {
    say(std::string(usage) + "\n");
    return wrongUsage;
  }
  prepareProcess();
  const auto paths = platform::linux_::Paths::ofArgument(*root);
  platform::linux_::UnifiedLog log(!paths.root.empty());
  platform::installLogSink(log);
  const auto alive = takeRoot(paths);
  if (!alive) return failed;

  platform::linux_::EventLoop loop;
  platform::linux_::LinuxFileSystem files(nullptr);  // nothing is watched
  hearth::ServiceManager manager(loop, files, paths);
  const auto stop = [&] { manager.stop([&] { loop.stop(); }); };
  const auto terminated = loop.watchSignal(SIGTERM, stop);
  const auto interrupted = loop.watchSignal(SIGINT, stop);
  if (!manager.start(announceReady)) return failed;
  loop.run();
  return 0;
}
