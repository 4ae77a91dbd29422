// The file layer that all stores stand on: Linux's own, and in tests one in memory that loses what was not
// synced.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Result.hpp"

namespace platform::linux_ {

// Tells whether a path still is the file that was loaded. The kernel reuses an inode as soon as the old file
// is gone, so identity means something only while the loaded file is held open.
struct FileIdentity {
  std::uint64_t device = 0;
  std::uint64_t inode = 0;
  std::int64_t size = 0;
  std::int64_t modifiedNanoseconds = 0;
  friend bool operator==(const FileIdentity&, const FileIdentity&) = default;
};

// An open file, closed with its owner.
class File {
 public:
  virtual ~File() = default;
  virtual Result<FileIdentity> identity() = 0;
  // Everything from the start; Outcome::tooLarge beyond `limit` bytes.
  virtual Result<std::string> readAll(std::size_t limit) = 0;
  virtual Result<void> writeAll(std::string_view bytes) = 0;
  virtual Result<void> sync() = 0;
};

// An exclusive lock, held until destroyed.
class FileLock {
 public:
  virtual ~FileLock() = default;
};

// Reports on a folder until destroyed.
class FolderWatch {
 public:
  virtual ~FolderWatch() = default;
};

// Paths are absolute or relative to the process's folder. Errors of the system pass through with errno's
// category. Any thread.
class FileSystem {
 public:
  virtual ~FileSystem() = default;
  virtual Result<std::unique_ptr<File>> openToRead(const std::string& path) = 0;
  // The same in a folder that strangers write to: no link is followed, and nothing but a plain file opened
  // (Outcome::notPermitted).
  virtual Result<std::unique_ptr<File>> openUntrusted(const std::string& path) = 0;
  // A new file, mode 0600; fails where one exists.
  virtual Result<std::unique_ptr<File>> create(const std::string& path) = 0;
  virtual Result<FileIdentity> identity(const std::string& path) = 0;
  virtual Result<void> rename(const std::string& from, const std::string& to) = 0;
  virtual Result<void> remove(const std::string& path) = 0;
  virtual Result<void> syncFolder(const std::string& path) = 0;
  // With its parents, mode 0700.
  virtual Result<void> makeFolder(const std::string& path) = 0;
  // Names, sorted.
  virtual Result<std::vector<std::string>> list(const std::string& folder) = 0;
  // Waits for the lock on `path`, a file of its own that is made if need be. Opened read-only, or every
  // release would wake the watchers of its folder.
  virtual Result<std::unique_ptr<FileLock>> lock(const std::string& path) = 0;
  // `changed` gets the name of each file in `folder` that was replaced, written, deleted or moved away, and
  // an empty name when everything may have changed (an overflow, the folder itself renamed or made anew). It
  // is called on the delivery thread; after the watch has been destroyed it is not.
  virtual Result<std::unique_ptr<FolderWatch>> watch(
      const std::string& folder, std::function<void(const std::string& name)> changed) = 0;
};

// The folder that `path` lies in.
std::string folderOf(const std::string& path);

// An open file, so that its identity stays its own.
struct HeldFile {
  std::unique_ptr<File> file;
  FileIdentity identity;
};
Result<HeldFile> hold(FileSystem& files, const std::string& path);

// The whole of a file.
Result<std::string> readFile(FileSystem& files, const std::string& path, std::size_t limit);

// Makes `folder` with its entry in each folder above, which a power cut would take otherwise; whether an
// earlier attempt or another process made it, and was cut off, cannot be told.
Result<void> makeFolderDurably(FileSystem& files, const std::string& folder);

// Moves a damaged file aside, under a name that is new; the name.
Result<std::string> moveAside(FileSystem& files, const std::string& path);

// Replaces `path`, durably and in one step: temporary file beside it, sync, rename, sync of the folder. On
// failure the old file is as it was and the temporary one is gone; where the last sync alone fails, the new
// one is there. The new file, held.
Result<HeldFile> replaceFile(FileSystem& files, const std::string& path, std::string_view bytes);

}  // namespace platform::linux_
