// The account that a device shares its cloud store with: looked at and changed through cloudsyncd.
#pragma once

#include <chrono>
#include <optional>
#include <string>

#include "cloudsyncd/CloudFile.hpp"
#include "platform/Result.hpp"
#include "platform/Value.hpp"
#include "platform/linux/FileSystem.hpp"
#include "platform/linux/Paths.hpp"
#include "tools/Output.hpp"

namespace tools {

// Which account, as the command line has it.
struct AccountOptions {
  std::string url;  // empty: none
  std::string name;
  std::string access;  // a file with further fields of etc/cloud.json: what is secret is on no command line
};
// Says what is wrong, if something is.
std::optional<cloudsync::Membership> membershipOf(const AccountOptions& options);

class Cloud {
 public:
  // The references outlive the object.
  Cloud(const platform::linux_::Paths& paths, platform::linux_::FileSystem& files);

  // The commands; each prints, and answers how to exit.
  Exit status(Output& output);
  Exit use(const AccountOptions& account);
  Exit forget(const std::string& device);
  // Also without cloudsyncd.
  Exit makeNewIdentity(Output& output);

 private:
  platform::Result<platform::List> call(const std::string& operation, const platform::List& arguments,
                                        std::chrono::milliseconds patience);
  // `refusal` is said before what cloudsyncd has against it.
  Exit perform(const std::string& operation, const std::string& argument, const std::string& refusal);
  Exit fail(std::error_code error) const;

  const platform::linux_::Paths& paths;
  platform::linux_::FileSystem& files;
  const std::string socket;
  std::string answer;  // the error that cloudsyncd answered
};

}  // namespace tools
