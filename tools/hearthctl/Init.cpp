#include "tools/hearthctl/Init.hpp"

#include <sys/stat.h>

#include <cstdint>
#include <filesystem>
#include <system_error>
#include <utility>
#include <vector>

#include "cloudsyncd/CloudFile.hpp"
#include "cloudsyncd/CloudInterface.hpp"
#include "cloudsyncd/Transports.hpp"
#include "pairwelld/Names.hpp"
#include "platform/EventStreams.hpp"
#include "platform/linux/Entitlements.hpp"
#include "platform/linux/Json.hpp"

namespace tools {
namespace {

namespace fs = std::filesystem;
namespace names = pairwell::names;
using platform::Dictionary;
using platform::EventStreams;
using platform::List;
using platform::Result;
using platform::linux_::EntitlementGrant;
using platform::linux_::FileSystem;

Dictionary deviceFile(const Device& device) {
  Dictionary fields{{"BuildVersion", device.build}};
  if (!device.name.empty()) fields.emplace("UserAssignedDeviceName", device.name);
  if (device.isInternal) fields.emplace("InternalBuild", true);
  return fields;
}

Dictionary cloudJobFile(const fs::path& programs) {
  return {{"name", "com.kestrel.cloudsyncd"},
          {"program", (programs / "cloudsyncd").string()},
          {"services", List{std::string(cloudsync::cloudService)}}};
}

Dictionary jobFile(const fs::path& programs) {
  return {{"name", std::string(names::job)},
          {"program", (programs / "pairwelld").string()},
          {"services", List{std::string(names::service)}},
          {"streams", List{std::string(EventStreams::alarms), std::string(EventStreams::matching)}}};
}

Dictionary entitlementFile(const fs::path& programs) {
  return {{"executable", (programs / "pairwellctl").string()},
          {"entitlements", Dictionary{{std::string(names::systemEntitlement), true}}}};
}

// Exclusive, so that nothing is overwritten, not even what appears meanwhile.
Result<void> writeNew(FileSystem& files, const fs::path& path, const Dictionary& fields) {
  const auto text = platform::linux_::printJson(fields, platform::linux_::JsonStyle::indented);
  if (!text) return text.error();
  std::error_code error;
  fs::create_directories(path.parent_path(), error);
  if (error) return error;
  const auto file = files.create(path);
  if (!file) return file.error();
  auto written = (*file)->writeAll(*text + "\n");
  if (written) written = (*file)->sync();
  if (!written) static_cast<void>(files.remove(path));
  return written ? files.syncFolder(path.parent_path()) : written;
}

std::string describeOwner(const EntitlementGrant& grant) {
  std::string text;
  if (grant.user) text = "uid " + std::to_string(*grant.user);
  if (grant.group) text += (text.empty() ? "gid " : " gid ") + std::to_string(*grant.group);
  return text.empty() ? "anyone" : text;
}

}  // namespace

Exit init(Output& output, const platform::linux_::Paths& paths, FileSystem& files, const Device& device) {
  // Clients of other users reach the service through these folders, and a grant in one that others can write
  // would not count.
  ::umask(022);
  std::error_code error;
  const fs::path programs = fs::read_symlink("/proc/self/exe", error).parent_path();
  if (error) return fail("/proc/self/exe", error);
  std::vector<std::pair<std::string, Dictionary>> wanted = {
      {paths.device(), deviceFile(device)},
      {paths.jobs() + "/com.kestrel.pairwelld.json", jobFile(programs)},
      {paths.entitlements() + "/pairwellctl.json", entitlementFile(programs)}};
  if (!device.account.url.empty()) {
    const auto membership = membershipOf(device.account);
    if (!membership) return wrongUsage;
    wanted.emplace_back(paths.cloud(), cloudsync::fieldsOf(*membership));
    wanted.emplace_back(paths.jobs() + "/com.kestrel.cloudsyncd.json", cloudJobFile(programs));
  }
  for (const auto& [path, fields] : wanted) {
    const auto written = writeNew(files, path, fields);
    if (!written && written.error() != std::errc::file_exists) return fail(path, written.error());
    const std::string result = written ? "written" : "kept";
    output.add({{"file", path}, {"result", result}}, {result, path});
  }
  output.print();
  for (const EntitlementGrant& grant : platform::linux_::readGrants(files, paths)) {
    if (!grant.problem.empty()) say(grant.file + " does not count: " + grant.problem);
  }
  return done;
}

Exit listGrants(Output& output, const platform::linux_::Paths& paths, FileSystem& files) {
  for (const EntitlementGrant& grant : platform::linux_::readGrants(files, paths)) {
    const bool counts = grant.problem.empty();
    Dictionary object{{"file", grant.file},
                      {"executable", grant.executable},
                      {"entitlements", grant.entitlements},
                      {"counts", counts}};
    if (grant.user) object.emplace("uid", std::int64_t{*grant.user});
    if (grant.group) object.emplace("gid", std::int64_t{*grant.group});
    if (!counts) object.emplace("problem", grant.problem);
    const std::string name = fs::path(grant.file).filename();
    if (counts) {
      output.add(object,
                 {name, grant.executable, describeOwner(grant), platform::describe(grant.entitlements)});
    } else {
      output.add(object, {name, "does not count: " + grant.problem});
    }
  }
  output.print();
  return done;
}

}  // namespace tools
