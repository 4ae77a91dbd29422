// Properties of the device: what its administrator says in etc/device.json, else what the machine knows.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Environment.hpp"
#include "platform/linux/DeviceFile.hpp"

namespace platform::linux_ {

// An entry of the file is a value, or {"value": v, "error": n}, either of the two alone included, to have a
// query fail.
class FileDeviceProperties : public DeviceProperties {
 public:
  // Both outlive the object; `files` is the machine's.
  FileDeviceProperties(FileSystem& files_, DeviceFile& device_) : files(files_), device(device_) {}

  std::optional<Value> copyAnswerWithError(std::string_view key, std::int32_t& error) override;
  // The file's "InternalBuild".
  int isInternalBuild() override;

 private:
  std::optional<std::string> machineAnswer(std::string_view key);

  FileSystem& files;
  DeviceFile& device;
};

// Knows "kern.bootsessionuuid": the kernel's boot identifier in upper case, or the device file's
// "BootSessionUUID", so that a reboot can be shown. Other names are ENOENT, a short buffer is ENOMEM; without
// one `length` gets what is needed.
class LinuxSystemControl : public SystemControl {
 public:
  LinuxSystemControl(FileSystem& files_, DeviceFile& device_) : files(files_), device(device_) {}

  int sysctlbyname(const char* name, void* buffer, std::size_t* length) override;

 private:
  FileSystem& files;
  DeviceFile& device;
};

}  // namespace platform::linux_
