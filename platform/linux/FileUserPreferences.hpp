// The process's own preferences, in a settings file.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Stores.hpp"
#include "platform/linux/SettingsFile.hpp"

namespace platform::linux_ {

// One a process. Without a delivery queue it reads and writes alike, but does not hear of others' writes.
class FileUserPreferences : public UserPreferences, public std::enable_shared_from_this<FileUserPreferences> {
 public:
  // `files` and `delivery`, on whose thread the former reports, outlive the object.
  static std::shared_ptr<FileUserPreferences> create(FileSystem& files, WorkQueue* delivery,
                                                     std::string path);

  void setValue(const std::optional<Value>& value, std::string_view key) override;
  void addObserver(std::weak_ptr<KeyObserver> observer, std::string_view key) override;
  void removeObserver(const KeyObserver* observer, std::string_view key) override;

 private:
  struct Registration {
    std::weak_ptr<KeyObserver> observer;
    const KeyObserver* address;
    std::string key;
  };

  FileUserPreferences(FileSystem& files, std::string path);
  std::optional<Value> read(std::string_view key) override;
  // Calls the key's observers, no lock held.
  void report(const std::string& key);
  bool isRegistered(const KeyObserver* observer, std::string_view key);

  const std::shared_ptr<SettingsFile> file;
  std::mutex mutex;
  std::vector<Registration> registrations;  // guarded by `mutex`
};

}  // namespace platform::linux_
