#include "platform/linux/ReplicaFileCloudStore.hpp"

#include <utility>

#include "platform/LogSink.hpp"
#include "platform/linux/SettingsDocument.hpp"

namespace platform::linux_ {
std::shared_ptr<ReplicaFileCloudStore> ReplicaFileCloudStore::create(FileSystem& files, WorkQueue* delivery,
                                                                     NotificationCentre& centre, Clock& clock,
                                                                     std::string path) {
  std::shared_ptr<ReplicaFileCloudStore> store(
      new ReplicaFileCloudStore(files, centre, clock, std::move(path)));
  if (!delivery) return store;
  store->file->startWatching(
      *delivery, [weak = std::weak_ptr(store)](const Dictionary& before, const Dictionary& after) {
        const auto self = weak.lock();
        if (!self) return;
        for (const CloudReport& report : cloudReports(before, after)) self->report(report);
      });
  return store;
}

ReplicaFileCloudStore::ReplicaFileCloudStore(FileSystem& files, NotificationCentre& centre_, Clock& clock_,
                                             std::string path)
    : centre(centre_), clock(clock_), file(SettingsFile::create(files, std::move(path))) {}

std::optional<Value> ReplicaFileCloudStore::read(std::string_view key) {
  std::lock_guard lock(mutex);
  const auto document = file->contents();
  const auto entry = CloudEntry::find(settingsValues(*document), key);
  const std::optional<Value> value = entry ? entry->value : std::nullopt;
  lastKnown.insert_or_assign(std::string(key), value);
  return value;
}

void ReplicaFileCloudStore::setValue(const std::optional<Value>& value, std::string_view key) {
  if (const auto written = write(value, key); !written) {
    hearthLog("files").error("cloud store: %s cannot be stored: %s", key, written.error().message());
  }
}

Result<void> ReplicaFileCloudStore::write(const std::optional<Value>& value, std::string_view key) {
  std::lock_guard writeLock(writeMutex);
  // Of before the file's lock: waiting for it must not part what is written together, either.
  CloudWrite write{std::string(key), value, std::nullopt, clock.now(), {}};
  {
    std::lock_guard lock(mutex);
    if (const auto known = lastKnown.find(key); known != lastKnown.end()) write.lastKnown = known->second;
  }
  CloudBursts next = bursts;
  bool changed = false;
  const auto written = file->update([&](Dictionary& document) {
    write.device = cloudDeviceOf(document);
    return changed = next.write(settingsValues(document), write);
  });
  std::lock_guard lock(mutex);
  isDurable = written.has_value();
  if (!written) return written;
  if (changed) next.finished(clock.now());  // an echo prolongs no burst
  bursts = next;
  lastKnown.insert_or_assign(write.key, value);
  return written;
}

Result<void> ReplicaFileCloudStore::replaceValues(const Dictionary& values) {
  return file->update([&](Dictionary& document) {
    const std::string device = cloudDeviceOf(document);
    Dictionary& entries = settingsValues(document);
    CloudBursts own;
    bool changed = false;
    for (const std::string& key : differingKeys(cloudValues(entries), values)) {
      changed |= own.write(entries, {key, valueOf(values, key), std::nullopt, clock.now(), device});
    }
    return changed;
  });
}

bool ReplicaFileCloudStore::synchronise() {
  std::lock_guard lock(mutex);
  return isDurable;
}

Dictionary ReplicaFileCloudStore::dictionaryRepresentation() {
  return cloudValues(settingsValues(*file->contents()));
}

void ReplicaFileCloudStore::report(const CloudReport& report) {
  List keys(report.keys.begin(), report.keys.end());
  Dictionary userInfo;
  userInfo.emplace(changeReasonKey, static_cast<int>(report.reason));
  userInfo.emplace(changedKeysKey, std::move(keys));
  centre.post(externalChangeNotification, static_cast<CloudStore*>(this), std::move(userInfo));
}

}  // namespace platform::linux_
