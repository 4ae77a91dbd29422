// etc/cloud.json: which account the operator wants the device to be in, and how to come in there.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/Result.hpp"
#include "platform/Value.hpp"
#include "platform/linux/FileSystem.hpp"

namespace cloudsync {

// The fields of the file, an object; what is empty is left out there. Those after the first two are an
// engine's that asks for them.
struct Membership {
  std::string url;               // "url"
  std::string account;           // "account"
  std::string password = {};     // "password", of the user in the URL
  std::string credentials = {};  // "credentials", a file as the engine's own tools make it
  std::string authorities = {};  // "authorities", a file: certificates trusted instead of the system's
  std::string certificate = {};  // "certificate" and "key", files: the device's own
  std::string key = {};
  std::optional<bool> tls = {};  // "tls": by default everywhere but to this machine itself
  friend bool operator==(const Membership&, const Membership&) = default;
};

// Outcome::malformedFile for anything but such an object, and `problem` says what and where. Whether the
// fields are right is another question: problemOf().
platform::Result<Membership> parseMembership(std::string_view text, std::string& problem);
platform::Dictionary fieldsOf(const Membership& membership);

// std::errc::no_such_file_or_directory without a file; otherwise as parseMembership().
platform::Result<Membership> readCloudFile(platform::linux_::FileSystem& files, const std::string& path,
                                           std::string& problem);
// Durably, in one step, for its owner alone to read.
platform::Result<void> writeCloudFile(platform::linux_::FileSystem& files, const std::string& path,
                                      const Membership& membership);

}  // namespace cloudsync
