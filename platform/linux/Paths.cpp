#include "platform/linux/Paths.hpp"

namespace platform::linux_ {

Paths Paths::under(const std::string& root) {
  if (root.empty()) return {"", "/etc/pairwell", "/var/lib/pairwell", "/run/pairwell"};
  return {root, root + "/etc", root + "/var", root + "/run"};
}

}  // namespace platform::linux_
