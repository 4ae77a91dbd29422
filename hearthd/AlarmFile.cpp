#include "hearthd/AlarmFile.hpp"

#include <system_error>
#include <utility>

#include "hearthd/JobFile.hpp"
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

platform::Result<Alarms> AlarmFile::load() {
  auto bytes = platform::linux_::readFile(files, path, fileLimit);
  // A disk may refuse once, and alarms that are aside are not kept.
  if (!bytes && bytes.error() == std::errc::io_error)
    bytes = platform::linux_::readFile(files, path, fileLimit);
  if (!bytes && bytes.error() == std::errc::no_such_file_or_directory) return Alarms();
  if (!bytes && mayPass(bytes.error())) {
    log().error("%s: %s; hearthd ends", path, bytes.error().message());
    return bytes.error();
  }
  std::string problem = bytes ? "" : bytes.error().message();
  const auto value =
      bytes ? platform::linux_::parseJson(*bytes, problem) : platform::Result<platform::Value>(bytes.error());
  if (value) {
    if (auto alarms = Alarms::fromValue(*value)) return std::move(*alarms);
    problem = "is not a list of alarms";
  }
  moveAside(problem);
  return Alarms();
}

platform::Result<void> AlarmFile::save(const Alarms& alarms) {
  if (failure == platform::Outcome::malformedFile) return failure;
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
  if (moved) {
    log().error("%s: %s; moved to %s", path, problem, *moved);
  } else {
    log().error("%s: %s; cannot be moved aside: %s; no alarm outlives this run", path, problem,
                moved.error().message());
    failure = platform::Outcome::malformedFile;
  }
}

}  // namespace hearth
