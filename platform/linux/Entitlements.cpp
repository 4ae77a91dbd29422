#include "platform/linux/Entitlements.hpp"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <utility>

#include "platform/LogSink.hpp"
#include "platform/linux/Json.hpp"

namespace platform::linux_ {
namespace {

namespace fs = std::filesystem;

constexpr std::size_t fileLimit = 64 * 1024;

bool isTrusted(uid_t owner) { return owner == 0 || owner == ::geteuid(); }

// Who else may write what lies at `path`, or put another thing in its place; empty if nobody. Links are
// followed one step at a time, since each may lie where others can change it.
std::string writableByOthers(const fs::path& path, int links = 0) {
  if (links > 40) return path.string() + ": too many links";
  fs::path place;  // has no link in it, so what is above it is its parent
  for (auto part = path.begin(); part != path.end(); ++part) {
    if (part->empty() || *part == ".") continue;
    if (*part == "..") {
      place = place.parent_path();
      continue;
    }
    place /= *part;
    struct stat status {};
    if (::lstat(place.c_str(), &status) != 0) return place.string() + ": " + std::strerror(errno);
    if (!isTrusted(status.st_uid)) return place.string() + " belongs to another user";
    if (S_ISLNK(status.st_mode)) {
      std::error_code error;
      fs::path target = fs::read_symlink(place, error);
      if (error) return place.string() + ": " + error.message();
      target = place.parent_path() / target;
      for (++part; part != path.end(); ++part) target /= *part;
      return writableByOthers(target, links + 1);
    }
    const bool sticky = S_ISDIR(status.st_mode) && (status.st_mode & S_ISVTX);
    if ((status.st_mode & (S_IWGRP | S_IWOTH)) && !sticky)
      return place.string() + " can be written by others";
  }
  return "";
}

// An identifier below the one that stands for none.
template <class Identifier>
bool readIdentifier(const Dictionary& fields, const char* name, std::optional<Identifier>& identifier) {
  const Value* found = find(fields, name);
  if (!found) return true;
  const auto number = toInteger(*found);
  if (!number || found->as<bool>() || *number < 0 || *number >= static_cast<Identifier>(-1)) return false;
  identifier = static_cast<Identifier>(*number);
  return true;
}

std::string readFields(const Value& value, const std::string& root, EntitlementGrant& grant) {
  const auto* fields = value.as<Dictionary>();
  if (!fields) return "not an object";
  const auto* path = find<std::string>(*fields, "executable");
  if (!path || path->empty() || path->find('\0') != path->npos)
    return "\"executable\" is not the path of a program";
  grant.executable = fs::path(*path).is_absolute() || root.empty() ? *path : root + "/" + *path;
  if (!fs::path(grant.executable).is_absolute()) return "\"executable\" is not an absolute path";
  if (!readIdentifier(*fields, "uid", grant.user)) return "\"uid\" is not a user's number";
  if (!readIdentifier(*fields, "gid", grant.group)) return "\"gid\" is not a group's number";
  const auto* granted = find<Dictionary>(*fields, "entitlements");
  if (!granted) return "\"entitlements\" is not an object";
  grant.entitlements = *granted;
  return "";
}

std::string readGrant(FileSystem& files, const std::string& root, EntitlementGrant& grant) {
  // Before it is read: what others can write says nothing.
  if (auto problem = writableByOthers(fs::absolute(grant.file)); !problem.empty()) return problem;
  const auto text = readFile(files, grant.file, fileLimit);
  if (!text) return text.error().message();
  std::string problem;
  const auto value = parseJson(*text, problem);
  if (!value) return problem;
  return readFields(*value, root, grant);
}

std::vector<EntitlementGrant> readFiles(FileSystem& files, const Paths& paths) {
  std::vector<EntitlementGrant> grants;
  const auto names = files.list(paths.entitlements());
  if (!names) {
    if (names.error() != std::errc::no_such_file_or_directory)
      grants.push_back({paths.entitlements(), "", {}, {}, {}, names.error().message()});
    return grants;
  }
  for (const std::string& name : *names) {
    if (!name.ends_with(".json")) continue;
    EntitlementGrant grant{paths.entitlements() + "/" + name, "", {}, {}, {}, ""};
    grant.problem = readGrant(files, paths.root, grant);
    grants.push_back(std::move(grant));
  }
  return grants;
}

void checkExecutable(EntitlementGrant& grant) {
  if (grant.problem.empty()) grant.problem = writableByOthers(fs::absolute(grant.executable));
}

bool isFor(const EntitlementGrant& grant, const PeerIdentity& peer) {
  if (grant.user && *grant.user != peer.uid) return false;
  if (grant.group && *grant.group != peer.gid) return false;
  struct stat status {};
  if (::stat(grant.executable.c_str(), &status) != 0) return false;
  return peer.executable == PeerIdentity::Executable{status.st_dev, status.st_ino};
}

}  // namespace

std::vector<EntitlementGrant> readGrants(FileSystem& files, const Paths& paths) {
  auto grants = readFiles(files, paths);
  std::for_each(grants.begin(), grants.end(), checkExecutable);
  return grants;
}

Entitlements::Entitlements(FileSystem& files_, Paths paths_) : files(files_), paths(std::move(paths_)) {}

Dictionary Entitlements::of(const PeerIdentity& peer) {
  Dictionary entitlements;
  for (EntitlementGrant& grant : readFiles(files, paths)) {
    if (grant.problem.empty() && !isFor(grant, peer)) continue;
    checkExecutable(grant);  // of those alone that may count: it takes as long as all the rest
    if (!grant.problem.empty()) {
      sayOnce(grant);
    } else if (isFor(grant, peer)) {  // once more: it must be the file that has just been looked at
      for (const auto& [name, value] : grant.entitlements) entitlements.insert_or_assign(name, value);
    }
  }
  return entitlements;
}

void Entitlements::sayOnce(const EntitlementGrant& grant) {
  {
    std::lock_guard lock(mutex);
    if (!said.insert(grant.file + "\n" + grant.problem).second) return;
  }
  hearthLog("entitlements").error("%s does not count: %s", grant.file, grant.problem);
}

}  // namespace platform::linux_
