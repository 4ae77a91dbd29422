// What lies in etc/, what the machine says of itself, and hearthd's own file of alarms.
#include <sys/stat.h>

#include <fstream>
#include <string>

#include "cloudsyncd/CloudFile.hpp"
#include "cloudsyncd/Transports.hpp"
#include "fuzz/Target.hpp"
#include "hearthd/AlarmFile.hpp"
#include "hearthd/JobFile.hpp"
#include "platform/linux/Entitlements.hpp"
#include "platform/linux/FileDeviceProperties.hpp"
#include "platform/linux/Json.hpp"
#include "tests/fakes/RealFiles.hpp"

namespace linux_ = platform::linux_;

namespace {

// Who may write to a grant and its program is asked of the disk, wherever their contents come from.
linux_::Paths pathsOnDisk() {
  static const fakes::TemporaryFolder root;
  const auto paths = linux_::Paths::under(root.path);
  if (std::filesystem::exists(paths.entitlements())) return paths;
  ::umask(022);
  std::filesystem::create_directories(paths.entitlements());
  for (const std::string& file : {paths.entitlements() + "/a.json", root.path + "/program"})
    std::ofstream{file};
  return paths;
}

void checkJob(fuzz::World& world, const std::string& folder) {
  auto jobs = hearth::readJobs(world.files, folder, "/root");
  fuzz::require(jobs && jobs->empty() == (world.logged().size() == 1));
  for (auto& job : *jobs) {
    fuzz::require(job.program.starts_with('/'));
    job.services.push_back(job.name);
    for (const std::string& name : job.services)
      fuzz::require(name.find_first_of(std::string_view("/\0", 2)) == std::string::npos &&
                    !name.starts_with('.'));
  }
}

void checkGrant(fuzz::World& world, const linux_::Paths& paths) {
  const auto grants = linux_::readGrants(world.files, paths);
  fuzz::require(grants.size() == 1 && (!grants[0].problem.empty() || grants[0].executable.starts_with('/')));
  // To who runs nothing.
  fuzz::require(linux_::Entitlements(world.files, paths).of(linux_::PeerIdentity()).empty());
}

void checkDevice(fuzz::World& world, const std::string& path) {
  linux_::DeviceFile file(world.files, path);
  linux_::FileDeviceProperties properties(world.files, file);
  std::int32_t error = 0;
  for (const char* key : {"UserAssignedDeviceName", "BuildVersion", "ProductVersion", "UniqueDeviceID"})
    static_cast<void>(properties.copyAnswerWithError(key, error));
  static_cast<void>(properties.isInternalBuild());
  char buffer[37];
  std::size_t length = sizeof buffer;
  if (linux_::LinuxSystemControl(world.files, file).sysctlbyname("kern.bootsessionuuid", buffer, &length) ==
      0)
    fuzz::require(length <= sizeof buffer && buffer[length - 1] == '\0');
}

void checkAlarms(fuzz::World& world, std::string_view text, const std::string& path) {
  hearth::AlarmFile file(world.files, path);
  auto alarms = *file.load();
  if (!world.files.exists(path)) fuzz::require(world.files.bytes(path + ".damaged-1") == text);
  for (const auto& alarm : alarms.list()) alarms.handlerInstalled(alarm.key.job, alarm.key.stream, {});
  for (const auto& alarm : alarms.takeDue({platform::Time(1e9), platform::Time(9)}))
    fuzz::require(alarms.set(alarm.key, alarm.date) > alarm.generation);
  static_cast<void>(alarms.next({}));
  fuzz::require(file.save(alarms).has_value());
  fuzz::require(file.load()->toValue() == alarms.toValue());
}

void checkCloud(std::string_view text) {
  std::string problem;
  const auto membership = cloudsync::parseMembership(text, problem);
  fuzz::require(membership || !problem.empty());
  if (!membership) return;
  static_cast<void>(cloudsync::problemOf(*membership));
  const auto kept = linux_::printJson(cloudsync::fieldsOf(*membership), linux_::JsonStyle::line);
  fuzz::require(kept && *cloudsync::parseMembership(*kept, problem) == *membership);
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const auto text = fuzz::textOf(data, size);
  const auto paths = pathsOnDisk();
  fuzz::World world;
  for (const std::string& path :
       {paths.jobs() + "/a.json", paths.entitlements() + "/a.json", paths.device(), paths.alarms(),
        std::string("/etc/os-release"), std::string("/etc/machine-id")})
    world.files.put(path, text);
  checkJob(world, paths.jobs());
  checkGrant(world, paths);
  checkDevice(world, paths.device());
  checkAlarms(world, text, paths.alarms());
  checkCloud(text);
  return 0;
}
