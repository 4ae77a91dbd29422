#include "platform/linux/FileRadixController.hpp"

#include <optional>
#include <utility>

#include "platform/LogSink.hpp"
#include "platform/linux/SettingsDocument.hpp"

namespace platform::linux_ {

FileRadixController::FileRadixController(FileSystem& files, std::string path)
    : file(SettingsFile::create(files, std::move(path))) {}

Result<Dictionary> FileRadixController::readPrefKeys(const std::vector<std::string>& keys) {
  const auto document = file->read();
  if (!document) return document.error();
  const Dictionary& values = settingsValues(**document);
  Dictionary found;
  for (const std::string& key : keys) {
    if (const auto entry = values.find(key); entry != values.end()) found.insert(*entry);
  }
  return found;
}

Result<void> FileRadixController::writePrefKey(std::string_view key, const Value& value) {
  const bool removed = value.as<std::nullptr_t>() != nullptr;
  const auto written = file->setValue(key, removed ? std::nullopt : std::optional(value));
  if (!written)
    hearthLog("files").error("root preferences: %s cannot be stored: %s", key, written.error().message());
  return written;
}

}  // namespace platform::linux_
