// The cloud store: this device's replica of it, in a settings file.
#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Environment.hpp"
#include "platform/NotificationCentre.hpp"
#include "platform/Stores.hpp"
#include "platform/linux/CloudReplica.hpp"
#include "platform/linux/SettingsFile.hpp"

namespace platform::linux_ {

// One a process. Without a delivery queue it reads and writes alike, but does not hear of others' writes. The
// device that stamps carry is named in the file: processes of one root are one device, and it costs no file
// of its own.
class ReplicaFileCloudStore : public CloudStore, public std::enable_shared_from_this<ReplicaFileCloudStore> {
 public:
  // The first four outlive the object; the files report on the thread of `delivery`.
  static std::shared_ptr<ReplicaFileCloudStore> create(FileSystem& files, WorkQueue* delivery,
                                                       NotificationCentre& centre, Clock& clock,
                                                       std::string path);

  void setValue(const std::optional<Value>& value, std::string_view key) override;
  // Key observation does not exist here.
  void addObserver(std::weak_ptr<KeyObserver>, std::string_view) override {}
  void removeObserver(const KeyObserver*, std::string_view) override {}
  bool synchronise() override;
  Dictionary dictionaryRepresentation() override;

  // setValue() for callers who want to know.
  Result<void> write(const std::optional<Value>& value, std::string_view key);
  // Makes `values` the whole contents, in one step: what an operator has edited. Keys that do not change keep
  // their entries, the others are written as by write(), with one timestamp.
  Result<void> replaceValues(const Dictionary& values);

 private:
  ReplicaFileCloudStore(FileSystem& files, NotificationCentre& centre, Clock& clock, std::string path);
  // A typed read: an equal write that follows is an echo.
  std::optional<Value> read(std::string_view key) override;
  void report(const CloudReport& report);

  NotificationCentre& centre;
  Clock& clock;
  const std::shared_ptr<SettingsFile> file;

  std::mutex writeMutex;  // held during a write; taken first
  CloudBursts bursts;     // guarded by `writeMutex`

  // Guards the rest. Held from a read to its record, or two threads' reads could be recorded in the wrong
  // order, and a write that is news be taken for an echo; never taken under the file's lock.
  std::mutex mutex;
  std::map<std::string, std::optional<Value>, std::less<>> lastKnown;  // by typed reads and writes
  bool isDurable = true;                                               // the last write
};

}  // namespace platform::linux_
