#include "pairwelld/Daemon.hpp"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <system_error>

#include "pairwelld/Log.hpp"
#include "pairwelld/SystemInfo.hpp"
#include "platform/Platform.hpp"

namespace pairwell {
namespace {

constexpr std::string_view lastVersionKey = "LastOSLaunchVersion";
constexpr std::string_view lastBootSessionKey = "lastLaunchBootSessionUUID";
constexpr std::string_view noBootSession = "Unable to get kern.bootsessionuuid!";

std::optional<SystemVersionNumber> recordedVersion() {
  const auto text = platform::current().userPreferences()->textForKey(lastVersionKey);
  return text ? SystemVersionNumber::fromString(*text) : std::nullopt;
}

std::optional<platform::UUID> recordedBootSession() {
  const auto text = platform::current().userPreferences()->textForKey(lastBootSessionKey);
  return text ? platform::UUID::parse(*text) : std::nullopt;
}

bool isASCII(std::string_view text) {
  return std::all_of(text.begin(), text.end(), [](char c) { return static_cast<unsigned char>(c) < 0x80; });
}

// The process stays in the C locale, whose messages are ASCII.
std::string errorText(int error) {
  std::string message = std::system_category().message(error);
  return isASCII(message) ? message : "Unknown";
}

}  // namespace

void Daemon::recordLaunch(const std::optional<SystemVersionNumber>& testLastVersion,
                          const std::optional<SystemVersionNumber>& testCurrentVersion) {
  if (testLastVersion && !testCurrentVersion) platform::stop("No testCurrentversion!");
  const bool isTest = testCurrentVersion.has_value();
  const auto current =
      isTest ? testCurrentVersion : SystemVersionNumber::fromString(SystemInfo().buildVersion());
  if (!current) return;
  const auto previous = isTest ? testLastVersion : recordedVersion();
  if (previous && !(*previous == *current)) migrate(*previous, *current);
  // The printed form, for every build alike. Where it differs from the raw text (19A5007 prints as 19A57)
  // each launch reports a migration, which is a line in the log and nothing else: migrate() converts no data.
  // One that does must not take two unequal texts for two builds.
  if (!isTest) platform::current().userPreferences()->setValue(current->description(), lastVersionKey);
  recordBootSession();
}

void Daemon::recordBootSession() {
  const platform::UUID boot = bootSessionUUID();
  const auto recorded = recordedBootSession();
  if (recorded == boot) {
    Log::daemon().default_("This is *NOT* the first run since reboot");
    return;
  }
  if (!recorded) Log::daemon().default_("No lastLaunchBootSessionUUID on record");
  recordFirstRunSinceBoot(boot);
}

platform::UUID Daemon::bootSessionUUID() {
  std::array<char, 37> buffer{};
  std::size_t length = buffer.size();
  if (platform::current().systemControl().sysctlbyname("kern.bootsessionuuid", buffer.data(), &length) != 0) {
    const int error = errno;
    // The parenthesis stays open: log queries match this very text.
    Log::daemon().error(
        "Error from sysctlbyname: %s(%d", [error] { return errorText(error); }, std::int32_t{error});
    platform::stop(noBootSession);
  }
  if (length == 0 || length > buffer.size()) platform::stop(noBootSession);
  const std::string_view text(buffer.data(), length - 1);
  const auto boot = isASCII(text) ? platform::UUID::parse(text) : std::nullopt;
  if (!boot) platform::stop(noBootSession);
  return *boot;
}

void Daemon::recordFirstRunSinceBoot(const platform::UUID& boot) {
  Log::daemon().default_("This is the first run since reboot");
  platform::current().userPreferences()->setValue(boot.text(), lastBootSessionKey);
  firstLaunchSinceBoot();
}

}  // namespace pairwell
