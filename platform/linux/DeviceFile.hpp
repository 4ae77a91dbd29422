// What the administrator of a root says about its device, in etc/device.json.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Value.hpp"
#include "platform/linux/FileSystem.hpp"

namespace platform::linux_ {

// Any thread. An object from property keys to values, read anew when the file has changed. The file belongs
// to its administrator: a broken one is named in the log, once, and left where it is; it then says nothing.
class DeviceFile {
 public:
  // `files` outlives the object.
  DeviceFile(FileSystem& files, std::string path);

  std::optional<Value> entry(std::string_view key);

 private:
  void refresh();

  FileSystem& files;
  const std::string path;
  std::mutex mutex;  // guards the rest
  Dictionary entries;
  std::unique_ptr<File> held;  // so that its inode is not reused
  FileIdentity heldIdentity;
  std::error_code failure;  // of the last look
};

}  // namespace platform::linux_
