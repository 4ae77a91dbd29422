// The machine's own files.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/linux/EventLoop.hpp"
#include "platform/linux/FileSystem.hpp"

namespace platform::linux_ {

class LinuxFileSystem : public FileSystem {
 public:
  // Watches report on the thread of `delivery`, which outlives them; without one there are none
  // (std::errc::not_supported).
  explicit LinuxFileSystem(EventLoop* delivery_) : delivery(delivery_) {}

  Result<std::unique_ptr<File>> openToRead(const std::string& path) override;
  Result<std::unique_ptr<File>> openUntrusted(const std::string& path) override;
  Result<std::unique_ptr<File>> create(const std::string& path) override;
  Result<FileIdentity> identity(const std::string& path) override;
  Result<void> rename(const std::string& from, const std::string& to) override;
  Result<void> remove(const std::string& path) override;
  Result<void> syncFolder(const std::string& path) override;
  Result<void> makeFolder(const std::string& path) override;
  Result<std::vector<std::string>> list(const std::string& folder) override;
  Result<std::unique_ptr<FileLock>> lock(const std::string& path) override;
  Result<std::unique_ptr<FolderWatch>> watch(const std::string& folder,
                                             std::function<void(const std::string& name)> changed) override;

 private:
  EventLoop* const delivery;
};

}  // namespace platform::linux_
