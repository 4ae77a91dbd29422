// cloudsyncd: a job of hearthd's that keeps the cloud replica and the account's other devices in step.
#include <signal.h>
#include <sys/stat.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <optional>
#include <string>

#include "cloudsyncd/Member.hpp"
#include "cloudsyncd/Service.hpp"
#include "platform/LogSink.hpp"
#include "platform/linux/EventLoop.hpp"
#include "platform/linux/InheritedDescriptors.hpp"
#include "platform/linux/LinuxFileSystem.hpp"
#include "platform/linux/Paths.hpp"
#include "platform/linux/ProcessLock.hpp"
#include "platform/linux/ProcessSetup.hpp"
#include "platform/linux/UnifiedLog.hpp"

namespace {

using platform::linux_::UniqueDescriptor;

constexpr int failed = 1;
constexpr int wrongUsage = 2;

// Two would each take the other for a copy of the disk.
std::optional<UniqueDescriptor> takeDevice(const platform::linux_::Paths& paths) {
  const std::string path = paths.run + "/cloudsyncd.lock";
  std::error_code ignored;  // the lock's own error says more
  std::filesystem::create_directories(paths.run, ignored);
  auto lock = platform::linux_::takeLock(path);
  if (!lock) std::fprintf(stderr, "cloudsyncd: %s: %s\n", path.c_str(), lock.error().message().c_str());
  if (lock && !*lock) std::fputs("cloudsyncd: already running\n", stderr);
  return lock && *lock ? std::optional(std::move(*lock)) : std::nullopt;
}

}  // namespace

int main(int count, char**) {
  if (count > 1) {
    std::fputs("usage: cloudsyncd, with HEARTH_ROOT for another root than the system's\n", stderr);
    return wrongUsage;
  }
  ::umask(022);
  platform::linux_::prepareSignals();
  const char* root = std::getenv("HEARTH_ROOT");
  const auto paths = platform::linux_::Paths::ofArgument(root ? root : "");
  platform::linux_::UnifiedLog log(!paths.root.empty());
  platform::installLogSink(log);
  const auto alone = takeDevice(paths);
  if (!alone) return failed;

  platform::linux_::EventLoop loop;
  platform::linux_::LinuxFileSystem files(&loop);
  cloudsync::Member member(loop, files, paths);
  std::optional<cloudsync::Service> service;
  if (auto socket = platform::linux_::takeInheritedDescriptor(cloudsync::cloudService))
    service.emplace(loop, member, std::move(socket));
  const auto terminated = loop.watchSignal(SIGTERM, [&] { loop.stop(); });
  const auto interrupted = loop.watchSignal(SIGINT, [&] { loop.stop(); });
  if (!member.start()) return failed;  // hearthd starts it again, later and later
  loop.run();
  return 0;
}
