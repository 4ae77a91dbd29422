#include "platform/linux/FileDeviceProperties.hpp"

#include <sys/utsname.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <limits>
#include <sstream>

namespace platform::linux_ {
namespace {

constexpr std::size_t sizeLimit = 64 << 10;

// The content of a file that holds one line, or nothing.
std::optional<std::string> line(FileSystem& files, const std::string& path) {
  auto text = readFile(files, path, sizeLimit);
  if (!text) return std::nullopt;
  text->erase(std::min(text->find('\n'), text->size()));
  return text->empty() ? std::nullopt : std::optional(std::move(*text));
}

std::string unquoted(const std::string& text) {
  const bool quoted =
      text.size() >= 2 && (text.front() == '"' || text.front() == '\'') && text.back() == text.front();
  return quoted ? text.substr(1, text.size() - 2) : text;
}

std::optional<std::string> osRelease(FileSystem& files, const std::string& name) {
  auto text = readFile(files, "/etc/os-release", sizeLimit);
  if (!text) text = readFile(files, "/usr/lib/os-release", sizeLimit);
  std::istringstream lines(text ? *text : "");
  for (std::string entry; std::getline(lines, entry);) {
    if (entry.starts_with(name + "=")) return unquoted(entry.substr(name.size() + 1));
  }
  return std::nullopt;
}

std::optional<std::string> hostName() {
  char name[256] = {};
  if (::gethostname(name, sizeof name - 1) < 0) return std::nullopt;
  return name;
}

std::optional<std::string> architecture() {
  utsname names;
  if (::uname(&names) < 0) return std::nullopt;
  return names.machine;
}

}  // namespace

std::optional<Value> FileDeviceProperties::copyAnswerWithError(std::string_view key, std::int32_t& error) {
  const auto entry = device.entry(key);
  if (!entry) return machineAnswer(key);
  const auto* fields = entry->as<Dictionary>();
  if (!fields) return entry;
  if (const Value* code = find(*fields, "error")) {
    using Limits = std::numeric_limits<std::int32_t>;
    const auto number = toInteger(*code);
    if (number)
      error = static_cast<std::int32_t>(std::clamp<std::int64_t>(*number, Limits::min(), Limits::max()));
  }
  return valueOf(*fields, "value");
}

int FileDeviceProperties::isInternalBuild() {
  const auto entry = device.entry("InternalBuild");
  return entry && toBool(*entry).value_or(false) ? 1 : 0;
}

std::optional<std::string> FileDeviceProperties::machineAnswer(std::string_view key) {
  if (key == "UserAssignedDeviceName") return hostName();
  if (key == "BuildVersion") return osRelease(files, "BUILD_ID");
  if (key == "ProductVersion") return osRelease(files, "VERSION_ID");
  if (key == "UniqueDeviceID") return line(files, "/etc/machine-id");
  if (key == "ProductType") return line(files, "/sys/class/dmi/id/product_name");
  if (key == "k7QIBwZJJOVw+Sej/8h8VA") return architecture();
  if (key == "/YYygAofPDbhrwToVsXdeA")
    return line(files, "/sys/class/dmi/id/board_name");  // the hardware model
  return std::nullopt;
}

int LinuxSystemControl::sysctlbyname(const char* name, void* buffer, std::size_t* length) {
  errno = ENOENT;
  if (std::string_view(name) != "kern.bootsessionuuid") return -1;
  const auto standIn = device.entry("BootSessionUUID");
  auto answer = standIn ? toText(*standIn) : std::nullopt;
  if (!answer) {
    answer = line(files, "/proc/sys/kernel/random/boot_id");
    if (!answer) {
      errno = ENOENT;
      return -1;
    }
    std::transform(answer->begin(), answer->end(), answer->begin(),
                   [](char c) { return c >= 'a' && c <= 'z' ? static_cast<char>(c - 'a' + 'A') : c; });
  }
  const std::size_t needed = answer->size() + 1;
  if (buffer && *length < needed) {
    errno = ENOMEM;
    return -1;
  }
  if (buffer) std::memcpy(buffer, answer->c_str(), needed);
  *length = needed;
  return 0;
}

}  // namespace platform::linux_
