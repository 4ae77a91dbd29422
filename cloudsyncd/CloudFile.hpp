// etc/cloud.json, {"url": …, "account": …}: which account the operator wants the device to be in.
#pragma once

#include <optional>
#include <string>

#include "platform/Result.hpp"
#include "platform/Value.hpp"
#include "platform/linux/FileSystem.hpp"

namespace cloudsync {

struct Membership {
  std::string url;
  std::string account;
  friend bool operator==(const Membership&, const Membership&) = default;
};

// std::errc::no_such_file_or_directory without a file; Outcome::malformedFile for a wrong one, and `problem`
// says what and where.
platform::Result<Membership> readCloudFile(platform::linux_::FileSystem& files, const std::string& path,
                                           std::string& problem);
platform::Dictionary fieldsOf(const Membership& membership);
// Durably, in one step.
platform::Result<void> writeCloudFile(platform::linux_::FileSystem& files, const std::string& path,
                                      const Membership& membership);

}  // namespace cloudsync
