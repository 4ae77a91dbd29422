#include "platform/linux/InheritedDescriptors.hpp"

#include <systemd/sd-daemon.h>

#include <cstdlib>
#include <map>
#include <mutex>
#include <string>
#include <utility>

namespace platform::linux_ {
namespace {

std::map<std::string, UniqueDescriptor, std::less<>> inherited() {
  std::map<std::string, UniqueDescriptor, std::less<>> descriptors;
  char** names = nullptr;
  const int count = sd_listen_fds_with_names(0, &names);  // also closes them on exec
  for (int index = 0; index < count; ++index) {
    descriptors.emplace(names[index], UniqueDescriptor(SD_LISTEN_FDS_START + index));
    std::free(names[index]);
  }
  std::free(names);
  return descriptors;
}

}  // namespace

UniqueDescriptor takeInheritedDescriptor(std::string_view name) {
  static std::mutex mutex;
  static auto& descriptors = *new auto(inherited());  // never closed behind the back of whoever took one
  std::lock_guard lock(mutex);
  const auto found = descriptors.find(name);
  return found == descriptors.end() ? UniqueDescriptor() : std::move(found->second);
}

}  // namespace platform::linux_
