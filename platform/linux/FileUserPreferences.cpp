#include "platform/linux/FileUserPreferences.hpp"

#include <algorithm>
#include <utility>

#include "platform/LogSink.hpp"
#include "platform/linux/SettingsDocument.hpp"

namespace platform::linux_ {

std::shared_ptr<FileUserPreferences> FileUserPreferences::create(FileSystem& files, WorkQueue* delivery,
                                                                 std::string path) {
  std::shared_ptr<FileUserPreferences> store(new FileUserPreferences(files, std::move(path)));
  if (!delivery) return store;
  store->file->startWatching(
      *delivery, [weak = std::weak_ptr(store)](const Dictionary& before, const Dictionary& after) {
        const auto self = weak.lock();
        if (!self) return;
        for (const std::string& key : differingKeys(settingsValues(before), settingsValues(after))) {
          self->report(key);
        }
      });
  return store;
}

FileUserPreferences::FileUserPreferences(FileSystem& files, std::string path)
    : file(SettingsFile::create(files, std::move(path))) {}

std::optional<Value> FileUserPreferences::read(std::string_view key) {
  const auto document = file->contents();
  return valueOf(settingsValues(*document), key);
}

void FileUserPreferences::setValue(const std::optional<Value>& value, std::string_view key) {
  if (const auto written = file->setValue(key, value); !written) {
    hearthLog("files").error("user preferences: %s cannot be stored: %s", key, written.error().message());
    return;
  }
  report(std::string(key));
}

void FileUserPreferences::addObserver(std::weak_ptr<KeyObserver> observer, std::string_view key) {
  const KeyObserver* address = observer.lock().get();
  std::lock_guard lock(mutex);
  registrations.push_back({std::move(observer), address, std::string(key)});
}

void FileUserPreferences::removeObserver(const KeyObserver* observer, std::string_view key) {
  std::lock_guard lock(mutex);
  std::erase_if(registrations,
                [&](const auto& entry) { return entry.address == observer && entry.key == key; });
}

void FileUserPreferences::report(const std::string& key) {
  std::vector<Registration> current;
  {
    std::lock_guard lock(mutex);
    current = registrations;
  }
  for (const Registration& entry : current) {
    if (entry.key != key) continue;
    // Another observer's call may have ended this registration.
    const auto observer = entry.observer.lock();
    if (observer && isRegistered(entry.address, key)) observer->observeValue(key, this);
  }
}

bool FileUserPreferences::isRegistered(const KeyObserver* observer, std::string_view key) {
  std::lock_guard lock(mutex);
  return std::any_of(registrations.begin(), registrations.end(),
                     [&](const auto& entry) { return entry.address == observer && entry.key == key; });
}

}  // namespace platform::linux_
