// The alarms on disk.
#pragma once

#include <string>

#include "hearthd/core/Alarms.hpp"
#include "platform/Result.hpp"
#include "platform/linux/FileSystem.hpp"

namespace hearth {

class AlarmFile {
 public:
  // Its folder is made when it is needed.
  AlarmFile(platform::linux_::FileSystem& files, std::string path);

  // A damaged file is moved aside, with a line in the log; one that cannot be read stays, and nothing can be
  // saved.
  Alarms load();
  // Durable once it has returned without an error, which is logged (once, until it is another).
  // Outcome::malformedFile where a file stays that must not be overwritten.
  platform::Result<void> save(const Alarms& alarms);

 private:
  platform::Result<void> write(const Alarms& alarms);
  void moveAside(const std::string& problem);

  platform::linux_::FileSystem& files;
  const std::string path;
  bool damageStays = false;
  std::error_code failure;  // of the last save
};

}  // namespace hearth
