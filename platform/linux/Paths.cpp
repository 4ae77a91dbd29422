#include "platform/linux/Paths.hpp"

#include <filesystem>

namespace platform::linux_ {

Paths Paths::under(const std::string& root) {
  if (root.empty()) return {"", "/etc/pairwell", "/var/lib/pairwell", "/run/pairwell"};
  return {root, root + "/etc", root + "/var", root + "/run"};
}

Paths Paths::ofArgument(const std::string& root) {
  if (root.empty()) return under(root);
  auto path = std::filesystem::absolute(root).lexically_normal().string();
  if (path.size() > 1 && path.back() == '/') path.pop_back();
  return under(path);
}

}  // namespace platform::linux_
