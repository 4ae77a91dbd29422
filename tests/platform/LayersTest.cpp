// With one include root a wrong include compiles, so the layers are checked here: every include line of a
// folder against what that folder may include.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <regex>

namespace {

namespace fs = std::filesystem;

struct Layer {
  std::string folder;                // its files, those of folders named by longer rows excepted
  std::vector<std::string> allowed;  // prefixes of quoted includes, and of angle includes other than std's
};

// The daemon proper stands on the standard library; main.cpp alone joins it to Linux.
const std::vector<Layer> layers = {
    {"platform/", {"platform/", "<utf8proc.h>"}},
    {"platform/linux/", {"platform/", "<systemd/", "<nlohmann/", "<sys/", "<linux/", "<POSIX>"}},
    {"pairwelld/", {"platform/", "pairwelld/"}},
    {"pairwelld/notifications/",
     {"platform/", "pairwelld/notifications/", "pairwelld/Log.hpp", "pairwelld/TarnNotificationHelper.hpp"}},
    {"pairwelld/settings/",
     {"platform/", "pairwelld/settings/", "pairwelld/notifications/", "pairwelld/Log.hpp"}},
    {"pairwelld/debug/",
     {"platform/", "pairwelld/debug/", "pairwelld/settings/", "pairwelld/notifications/",
      "pairwelld/Log.hpp"}},
    {"pairwelld/service/", {"platform/", "pairwelld/service/", "pairwelld/debug/", "pairwelld/Log.hpp"}},
    {"hearthd/", {"platform/", "hearthd/", "<systemd/", "<CLI/", "<sys/", "<linux/", "<POSIX>"}},
    {"hearthd/core/", {"platform/", "hearthd/core/"}},
    {"tools/",
     {"platform/", "tools/", "pairwelld/settings/Defaults.hpp", "pairwelld/settings/KeyValueSource.hpp",
      "pairwelld/service/RadixDistributedDebugLogging.hpp", "<CLI/", "<sys/", "<POSIX>"}},
};

const std::string posixHeaders =
    "<unistd.h> <fcntl.h> <poll.h> <signal.h> <dirent.h> <pwd.h> <grp.h> <spawn.h> <sched.h> <netinet/in.h>";

const Layer* layerOf(const std::string& path) {
  const Layer* best = nullptr;
  for (const Layer& layer : layers) {
    if (path.starts_with(layer.folder) && (!best || layer.folder.size() > best->folder.size())) best = &layer;
  }
  return best;
}

bool isAllowed(const Layer& layer, const std::string& path, const std::string& include) {
  if (path == "pairwelld/main.cpp" && include.starts_with("platform/linux/")) return true;
  // The interfaces' layer knows nothing of Linux.
  if (include.starts_with("platform/linux/") &&
      (layer.folder == "platform/" || layer.folder.starts_with("pairwelld/") ||
       layer.folder == "hearthd/core/")) {
    return false;
  }
  if (include.front() == '<' && include.find_first_of("./") == include.npos) return true;  // the standard's
  for (const std::string& prefix : layer.allowed) {
    if (prefix == "<POSIX>") {
      if (posixHeaders.find(include) != posixHeaders.npos) return true;
    } else if (include.starts_with(prefix)) {
      return true;
    }
  }
  return false;
}

TEST(Layers, EveryIncludePointsDown) {
  const fs::path root = SOURCE_ROOT;
  const std::regex line(R"(^\s*#\s*include\s+(?:"([^"]+)\"|(<[^>]+>)))");
  int seen = 0;
  for (const char* top : {"platform", "pairwelld", "hearthd", "tools"}) {
    for (const auto& entry : fs::recursive_directory_iterator(root / top)) {
      const auto extension = entry.path().extension();
      if (extension != ".cpp" && extension != ".hpp") continue;
      const std::string path = fs::relative(entry.path(), root).string();
      std::ifstream file(entry.path());
      for (std::string text; std::getline(file, text);) {
        std::smatch match;
        if (!std::regex_search(text, match, line)) continue;
        const std::string include = match[1].matched ? match[1].str() : match[2].str();
        ++seen;
        EXPECT_TRUE(isAllowed(*layerOf(path), path, include)) << path << " includes " << include;
      }
    }
  }
  EXPECT_GT(seen, 100);
}

}  // namespace
