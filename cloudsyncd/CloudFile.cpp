#include "cloudsyncd/CloudFile.hpp"

#include <utility>

#include "platform/Value.hpp"
#include "platform/linux/Json.hpp"

namespace cloudsync {
namespace {

using platform::Dictionary;
using platform::Outcome;
using platform::Result;

constexpr std::pair<const char*, std::string Membership::*> texts[] = {
    {"url", &Membership::url},
    {"account", &Membership::account},
    {"password", &Membership::password},
    {"credentials", &Membership::credentials},
    {"authorities", &Membership::authorities},
    {"certificate", &Membership::certificate},
    {"key", &Membership::key}};

// False: there is no such field, or it holds something else, or a NUL, to which alone the system and the
// libraries would read it.
bool take(const std::string& name, const platform::Value& value, Membership& membership) {
  if (name == "tls" && value.as<bool>()) return membership.tls = *value.as<bool>(), true;
  for (const auto& [field, member] : texts) {
    const auto* text = value.as<std::string>();
    if (name == field && text && text->find('\0') == text->npos) return membership.*member = *text, true;
  }
  return false;
}

}  // namespace

Result<Membership> parseMembership(std::string_view text, std::string& problem) {
  const auto value = platform::linux_::parseJson(text, problem);
  if (!value) return value.error();
  const auto* fields = value->as<Dictionary>();
  Membership membership;
  for (const auto& [name, field] : fields ? *fields : Dictionary()) {
    if (take(name, field, membership)) continue;
    problem = "\"" + name + "\" is no field, or of another type, or has a NUL in it";
    return Outcome::malformedFile;
  }
  if (fields) return membership;
  problem = "line 1: not an object";
  return Outcome::malformedFile;
}

Dictionary fieldsOf(const Membership& membership) {
  Dictionary fields;
  for (const auto& [field, member] : texts) {
    if (!(membership.*member).empty()) fields.emplace(field, membership.*member);
  }
  if (membership.tls) fields.emplace("tls", *membership.tls);
  return fields;
}

Result<Membership> readCloudFile(platform::linux_::FileSystem& files, const std::string& path,
                                 std::string& problem) {
  constexpr std::size_t sizeLimit = 64 << 10;
  const auto text = platform::linux_::readFile(files, path, sizeLimit);
  problem = text ? "" : text.error().message();
  return text ? parseMembership(*text, problem) : Result<Membership>(text.error());
}

Result<void> writeCloudFile(platform::linux_::FileSystem& files, const std::string& path,
                            const Membership& membership) {
  const auto text = platform::linux_::printJson(fieldsOf(membership), platform::linux_::JsonStyle::indented);
  return text ? platform::linux_::replaceFile(files, path, *text + "\n") : Result<void>(text.error());
}

}  // namespace cloudsync
