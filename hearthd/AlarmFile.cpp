#include "hearthd/AlarmFile.hpp"

#include <system_error>
#include <utility>

#include "platform/LogSink.hpp"
#include "platform/linux/Json.hpp"

namespace hearth {
namespace {

constexpr std::size_t fileLimit = 64 << 20;

const platform::Logger& log() {
  static const platform::Logger logger = platform::hearthLog("hearthd");
  return logger;
}

}  // namespace

AlarmFile::AlarmFile(platform::linux_::FileSystem& files_, std::string path_)
    : files(files_), path(std::move(path_)) {}

Alarms AlarmFile::load() {
  const auto bytes = platform::linux_::readFile(files, path, fileLimit);
  if (!bytes) {
    // What cannot be read now may be whole: it is left alone, and nothing is written over it.
    damageStays = bytes.error() != std::errc::no_such_file_or_directory;
    if (damageStays) log().error("%s: %s; no alarm outlives this run", path, bytes.error().message());
    return {};
  }
  std::string problem;
  const auto value = platform::linux_::parseJson(*bytes, problem);
  if (value) {
    if (auto alarms = Alarms::fromValue(*value)) return std::move(*alarms);
    problem = "is not a list of alarms";
  }
  moveAside(problem);
  return {};
}

platform::Result<void> AlarmFile::save(const Alarms& alarms) {
  if (damageStays) return platform::Outcome::malformedFile;
  const auto saved = write(alarms);
  const auto previous = std::exchange(failure, saved ? std::error_code() : saved.error());
  if (failure && failure != previous)
    log().error("%s: %s; the alarms are kept in memory until they can be stored", path, failure.message());
  return saved;
}

platform::Result<void> AlarmFile::write(const Alarms& alarms) {
  const auto text = platform::linux_::printJson(alarms.toValue(), platform::linux_::JsonStyle::indented);
  if (!text) return text.error();
  if (!files.identity(path)) {
    const auto made = platform::linux_::makeFolderDurably(files, platform::linux_::folderOf(path));
    if (!made) return made;
  }
  return platform::linux_::replaceFile(files, path, *text);
}

void AlarmFile::moveAside(const std::string& problem) {
  const auto moved = platform::linux_::moveAside(files, path);
  damageStays = !moved;
  if (moved) {
    log().error("%s: %s; moved to %s", path, problem, *moved);
  } else {
    log().error("%s: %s; cannot be moved aside: %s", path, problem, moved.error().message());
  }
}

}  // namespace hearth
