#include "tools/StoredSettings.hpp"

#include "pairwelld/Names.hpp"
#include "pairwelld/settings/Defaults.hpp"
#include "platform/linux/CloudReplica.hpp"
#include "platform/linux/SettingsDocument.hpp"
#include "platform/linux/SettingsFile.hpp"

namespace tools {

using pairwell::KeyValueSource;
using platform::Dictionary;
using platform::Result;

std::string settingsPath(const platform::linux_::Paths& paths, KeyValueSource source) {
  if (source == KeyValueSource::user) return paths.userSettings();
  if (source == KeyValueSource::root) return paths.rootSettings();
  return paths.cloudSettings(pairwell::names::cloudStore);
}

Result<Dictionary> storedValues(platform::linux_::FileSystem& files, const platform::linux_::Paths& paths,
                                KeyValueSource source, std::string& problem) {
  const auto text = platform::linux_::readFile(files, settingsPath(paths, source),
                                               platform::linux_::SettingsFile::sizeLimit);
  if (!text) return text.error();
  const auto document = platform::linux_::decodeSettings(*text, problem);
  if (!document) return document.error();
  const Dictionary& values = platform::linux_::settingsValues(*document);
  return source == KeyValueSource::cloud ? platform::linux_::cloudValues(values) : values;
}

std::optional<double> endIn(const Dictionary& values) {
  const auto* found =
      platform::find(values, platform::rawValue(pairwell::Defaults::velaLogCloudCollectionEnabledExpiration));
  const auto end = found ? platform::toDouble(*found) : std::nullopt;
  const bool counts = end && *end > 0 && platform::Date::ofSeconds(*end);
  return counts ? end : std::nullopt;
}

}  // namespace tools
