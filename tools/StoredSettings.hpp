// The stores' files, looked at without touching them.
#pragma once

#include <optional>
#include <string>

#include "pairwelld/settings/KeyValueSource.hpp"
#include "platform/Result.hpp"
#include "platform/Value.hpp"
#include "platform/linux/FileSystem.hpp"
#include "platform/linux/Paths.hpp"

namespace tools {

std::string settingsPath(const platform::linux_::Paths& paths, pairwell::KeyValueSource source);

// The values of a store. Not through a SettingsFile, which would move a damaged file aside: to look must
// change nothing. A document that does not parse gives Outcome::malformedFile and its place in `problem`.
platform::Result<platform::Dictionary> storedValues(platform::linux_::FileSystem& files,
                                                    const platform::linux_::Paths& paths,
                                                    pairwell::KeyValueSource source, std::string& problem);

// The end time among the cloud store's values, in seconds since 1970. One without an alarm date is none, as
// the daemon takes it.
std::optional<double> endIn(const platform::Dictionary& values);

}  // namespace tools
