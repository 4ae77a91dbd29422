// What an administrator writes in etc/: jobs, the device, entitlements, the account.
#include <string>

#include "cloudsyncd/CloudFile.hpp"
#include "cloudsyncd/Transports.hpp"
#include "fuzz/Target.hpp"
#include "hearthd/JobFile.hpp"
#include "platform/LogSink.hpp"
#include "platform/linux/DeviceFile.hpp"
#include "platform/linux/Entitlements.hpp"
#include "tests/fakes/MemoryFileSystem.hpp"

namespace {

struct SilentLog : platform::LogSink {
  bool enabled(const platform::LogChannel&, platform::LogLevel) override { return false; }
  void write(const platform::LogChannel&, platform::LogLevel, std::string_view,
             std::span<const platform::LogArgument>) override {}
};

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static SilentLog log;
  platform::installLogSink(log);
  const auto text = fuzz::textOf(data, size);
  const auto paths = platform::linux_::Paths::under("/nowhere");
  fakes::MemoryFileSystem files;
  for (const std::string& path : {paths.jobs() + "/a.json", paths.entitlements() + "/a.json", paths.device()})
    files.put(path, text);
  for (const auto& job : hearth::readJobs(files, paths.jobs(), "/nowhere"))
    fuzz::require(!job.name.empty() && job.program.starts_with('/'));
  for (const auto& grant : platform::linux_::readGrants(files, paths))
    fuzz::require(!grant.problem.empty());  // its executable is not there
  platform::linux_::DeviceFile(files, paths.device()).entry("DeviceName");

  std::string problem;
  const auto membership = cloudsync::parseMembership(text, problem);
  fuzz::require(membership || !problem.empty());
  if (membership) static_cast<void>(cloudsync::problemOf(*membership));
  return 0;
}
