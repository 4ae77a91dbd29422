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
  // Durable once it has returned without an error. Outcome::malformedFile where a file stays that
  // must not be overwritten.
  platform::Result<void> save(const Alarms& alarms);

 private:
  void moveAside(const std::string& problem);

  platform::linux_::FileSystem& files;
  const std::string path;
  bool damageStays = false;
};

}  // namespace hearth
