#include "cloudsyncd/core/Document.hpp"

#include <cstdint>

#include "platform/linux/CloudReplica.hpp"
#include "platform/linux/SettingsDocument.hpp"

namespace cloudsync {
namespace {

using platform::Dictionary;
using platform::Outcome;
using platform::Result;
using platform::linux_::CloudEntry;

// Raised when a reader of the former one would misunderstand what is written.
constexpr std::int64_t formatVersion = 1;

std::string textIn(const Dictionary& fields, std::string_view name) {
  const auto* text = platform::find<std::string>(fields, name);
  return text ? *text : "";
}

// Why it is no document of that device; empty if it is.
std::string refusal(const Dictionary& fields, const std::string& account, const std::string& device,
                    platform::Time now) {
  const auto* format = platform::find<std::int64_t>(fields, "format");
  if (!format) return "it has no format version";
  if (*format != formatVersion) return "its format version is not " + std::to_string(formatVersion);
  if (textIn(fields, "device") != device) return "it is of another device";
  if (textIn(fields, "account") != account) return "it is of another account";
  if (textIn(fields, "writer").empty()) return "it has no writer";
  const auto* values = platform::find<Dictionary>(fields, "values");
  if (!values) return "it has no values";
  for (const auto& [key, value] : *values) {
    const auto entry = CloudEntry::fromValue(value);
    if (!entry) return "it has an entry of another form";
    if (!entry->stamp.isCredible(now))
      return "it has an entry that is stamped more than a hundred years ahead";
  }
  if (platform::linux_::cloudValues(*values).size() > documentKeys)
    return "it has more than " + std::to_string(documentKeys) + " keys";
  return "";
}

}  // namespace

Dictionary publishableEntries(const Dictionary& entries, platform::Time now) {
  Dictionary publishable;
  for (const auto& [key, value] : entries) {
    const auto entry = CloudEntry::fromValue(value);
    if (entry && entry->stamp.isCredible(now)) publishable.emplace(key, value);
  }
  return publishable;
}

Result<std::string> encodeDocument(const Document& document) {
  if (platform::linux_::cloudValues(document.entries).size() > documentKeys) return Outcome::tooLarge;
  auto text = platform::linux_::encodeSettings({{"format", formatVersion},
                                                {"account", document.account},
                                                {"device", document.device},
                                                {"writer", document.writer},
                                                {"values", document.entries}});
  if (text && text->size() > documentBytes) return Outcome::tooLarge;
  return text;
}

Result<Document> decodeDocument(std::string_view text, const std::string& account, const std::string& device,
                                platform::Time now, std::string& problem) {
  if (text.size() > documentBytes) {
    problem = "it is larger than " + std::to_string(documentBytes) + " bytes";
    return Outcome::malformedFile;
  }
  const auto fields = platform::linux_::decodeSettings(text, problem);
  if (!fields) {
    // Without the place, which moves on with each piece of a document that is being copied.
    problem = "it does not parse, or does not match its checksum";
    return fields.error();
  }
  problem = refusal(*fields, account, device, now);
  if (!problem.empty()) return Outcome::malformedFile;
  return Document{account, device, textIn(*fields, "writer"), platform::linux_::settingsValues(*fields)};
}

bool isName(std::string_view text) {
  constexpr std::string_view allowed = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-_.";
  return !text.empty() && text.size() <= 64 && text.front() != '.' &&
         text.find_first_not_of(allowed) == std::string_view::npos;
}

}  // namespace cloudsync
