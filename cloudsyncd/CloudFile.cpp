#include "cloudsyncd/CloudFile.hpp"

#include "platform/Value.hpp"
#include "platform/linux/Json.hpp"

namespace cloudsync {

using platform::Dictionary;
using platform::Outcome;
using platform::Result;

Result<Membership> readCloudFile(platform::linux_::FileSystem& files, const std::string& path,
                                 std::string& problem) {
  constexpr std::size_t sizeLimit = 64 << 10;
  const auto text = platform::linux_::readFile(files, path, sizeLimit);
  problem = text ? "" : text.error().message();
  if (!text) return text.error();
  const auto value = platform::linux_::parseJson(*text, problem);
  if (!value) return value.error();
  const auto* fields = value->as<Dictionary>();
  const auto* url = fields ? platform::find<std::string>(*fields, "url") : nullptr;
  const auto* account = fields ? platform::find<std::string>(*fields, "account") : nullptr;
  if (url && account) return Membership{*url, *account};
  problem = "line 1: not an object with the texts \"url\" and \"account\"";
  return Outcome::malformedFile;
}

Dictionary fieldsOf(const Membership& membership) {
  return {{"url", membership.url}, {"account", membership.account}};
}

Result<void> writeCloudFile(platform::linux_::FileSystem& files, const std::string& path,
                            const Membership& membership) {
  const auto text = platform::linux_::printJson(fieldsOf(membership), platform::linux_::JsonStyle::indented);
  return text ? platform::linux_::replaceFile(files, path, *text + "\n") : Result<void>(text.error());
}

}  // namespace cloudsync
