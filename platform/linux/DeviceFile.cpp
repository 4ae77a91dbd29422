#include "platform/linux/DeviceFile.hpp"

#include <system_error>
#include <utility>

#include "platform/LogSink.hpp"
#include "platform/linux/Json.hpp"

namespace platform::linux_ {
namespace {

constexpr std::size_t sizeLimit = 1 << 20;

Result<Dictionary> parse(const std::string& text, std::string& problem) {
  const auto value = parseJson(text, problem);
  if (!value) return value.error();
  if (const auto* entries = value->as<Dictionary>()) return *entries;
  problem = "line 1, column 1: not an object";
  return Outcome::malformedFile;
}

}  // namespace

DeviceFile::DeviceFile(FileSystem& files_, std::string path_) : files(files_), path(std::move(path_)) {}

std::optional<Value> DeviceFile::entry(std::string_view key) {
  std::lock_guard lock(mutex);
  refresh();
  return valueOf(entries, key);
}

void DeviceFile::refresh() {
  const auto current = files.identity(path);
  if (current && held && *current == heldIdentity) return;
  entries.clear();
  held.reset();
  auto file = files.openToRead(path);
  const auto identity = file ? (*file)->identity() : Result<FileIdentity>(file.error());
  const auto text = identity ? (*file)->readAll(sizeLimit) : Result<std::string>(identity.error());
  const auto previous = std::exchange(failure, text ? std::error_code() : text.error());
  if (!text && text.error() != Outcome::tooLarge) {  // not held: the next look may be able to read it
    const bool isNews = failure != previous && failure != std::errc::no_such_file_or_directory;
    if (isNews) hearthLog("files").error("%s: %s; skipped", path, failure.message());
    return;
  }
  std::string problem = text ? "" : text.error().message();
  auto parsed = text ? parse(*text, problem) : Result<Dictionary>(text.error());
  if (!parsed) hearthLog("files").error("%s: %s; skipped", path, problem);
  if (parsed) entries = std::move(*parsed);
  heldIdentity = *identity;
  held = std::move(*file);
}

}  // namespace platform::linux_
