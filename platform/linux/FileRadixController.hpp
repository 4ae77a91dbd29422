// The Bluetooth stack's root preferences, in a settings file.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Stores.hpp"
#include "platform/linux/SettingsFile.hpp"

namespace platform::linux_ {

// Nothing is watched: whoever writes root preferences announces it by the named notification.
class FileRadixController : public RadixController {
 public:
  // `files` outlives the object.
  FileRadixController(FileSystem& files, std::string path);

  Result<Dictionary> readPrefKeys(const std::vector<std::string>& keys) override;
  Result<void> writePrefKey(std::string_view key, const Value& value) override;

 private:
  const std::shared_ptr<SettingsFile> file;
};

}  // namespace platform::linux_
