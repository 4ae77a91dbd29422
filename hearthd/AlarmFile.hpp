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

  // A file that is damaged, or cannot be read, is moved aside, with a line in the log; where that fails, too,
  // it stays, and nothing can be saved. What may pass is an error, and logged.
  platform::Result<Alarms> load();
  // Durable once it has returned without an error, which is logged (once, until it is another).
  // Outcome::malformedFile where a file stays that must not be overwritten.
  platform::Result<void> save(const Alarms& alarms);
  // Why the last save failed.
  const std::error_code& problem() const { return failure; }

 private:
  platform::Result<void> write(const Alarms& alarms);
  void moveAside(const std::string& problem);

  platform::linux_::FileSystem& files;
  const std::string path;
  std::error_code failure;  // of the last save; Outcome::malformedFile stays
};

}  // namespace hearth
