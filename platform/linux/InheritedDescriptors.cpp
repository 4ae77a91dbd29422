#include "platform/linux/InheritedDescriptors.hpp"

#include <systemd/sd-daemon.h>

#include <cstdlib>
#include <map>
#include <mutex>
#include <string>

namespace platform::linux_ {
namespace {

class Inherited {
 public:
  Inherited() {
    char** names = nullptr;
    const int count = sd_listen_fds_with_names(0, &names);  // also closes them on exec
    for (int index = 0; index < count; ++index) {
      descriptors.emplace(names[index], SD_LISTEN_FDS_START + index);
      std::free(names[index]);
    }
    std::free(names);
  }
  UniqueDescriptor take(std::string_view name) {
    std::lock_guard lock(mutex);
    const auto found = descriptors.find(name);
    if (found == descriptors.end()) return UniqueDescriptor();
    UniqueDescriptor taken(found->second);
    descriptors.erase(found);
    return taken;
  }
  bool has(std::string_view name) {
    std::lock_guard lock(mutex);
    return descriptors.find(name) != descriptors.end();
  }

 private:
  std::mutex mutex;
  // Bare numbers: what nobody takes is not closed behind anyone's back.
  std::map<std::string, int, std::less<>> descriptors;
};

Inherited& inherited() {
  static Inherited all;
  return all;
}

}  // namespace

UniqueDescriptor takeInheritedDescriptor(std::string_view name) { return inherited().take(name); }

bool hasInheritedDescriptor(std::string_view name) { return inherited().has(name); }

}  // namespace platform::linux_
