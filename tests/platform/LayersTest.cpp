// With one include root a wrong include compiles, so the layers are checked here: every include line of a
// folder against what that folder may include.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <regex>

namespace {

namespace fs = std::filesystem;

// Of each folder, folders named by longer rows excepted: the starts of what it may include, the standard
// library aside.
const std::map<std::string, std::string> layers = {
    {"platform/", "\"platform/(?!linux/)|<utf8proc.h>"},
    {"platform/linux/", "\"platform/|<systemd/|<nlohmann/|<sys/|<linux/|POSIX"},
    {"pairwelld/", "\"platform/(?!linux/)|\"pairwelld/"},
    // It alone joins the daemon proper, which stands on the standard library, to Linux.
    {"pairwelld/main.cpp", "\"platform/|\"pairwelld/"},
    {"pairwelld/notifications/",
     "\"platform/(?!linux/)|\"pairwelld/(notifications/|Log.hpp|TarnNotificationHelper.hpp)"},
    {"pairwelld/settings/", "\"platform/(?!linux/)|\"pairwelld/(settings/|notifications/|Log.hpp|Names.hpp)"},
    {"pairwelld/debug/",
     "\"platform/(?!linux/)|\"pairwelld/(debug/|settings/|notifications/|Log.hpp|Names.hpp)"},
    {"pairwelld/service/", "\"platform/(?!linux/)|\"pairwelld/(service/|debug/|Log.hpp|Names.hpp)"},
    {"hearthd/", "\"platform/|\"hearthd/|<systemd/|<CLI/|<sys/|<linux/|POSIX"},
    {"hearthd/core/", "\"platform/(?!linux/)|\"hearthd/core/"},
    {"cloudsyncd/", "\"platform/|\"cloudsyncd/|\"pairwelld/Names.hpp|<sys/|POSIX"},
    {"cloudsyncd/NatsConnection.cpp", "\"platform/Result.hpp\"|\"cloudsyncd/|<nats/|<time.h>|POSIX"},
    // Of the replica's file it knows the form, which is pairwelld's, too; it opens none.
    {"cloudsyncd/core/",
     "\"platform/(?!linux/)|\"platform/linux/(CloudReplica|SettingsDocument).hpp|\"cloudsyncd/core/"},
    {"tools/",
     "\"platform/|\"tools/|\"cloudsyncd/|\"pairwelld/(Names|settings/(Defaults|KeyValueSource)).hpp|"
     "\"pairwelld/service/RadixDistributedDebugLogging.hpp|<CLI/|<sys/|POSIX"},
};
const std::string posix = "<(unistd|fcntl|poll|signal|dirent|pwd|grp|spawn|sched|netinet/in)\\.h>";

bool isAllowed(const std::string& path, const std::string& include) {
  std::string best, allowed;
  for (const auto& [folder, starts] : layers) {
    if (!path.starts_with(folder) || folder.size() < best.size()) continue;
    best = folder;
    allowed = starts;
  }
  if (allowed.ends_with("POSIX")) allowed.replace(allowed.size() - 5, 5, posix);
  return std::regex_search(include, std::regex("^(<\\w+>|" + allowed + ")"));
}

TEST(Layers, EveryIncludePointsDown) {
  const fs::path root = SOURCE_ROOT;
  const std::regex line(R"(^\s*#\s*include\s+(.+))");
  int seen = 0;
  for (const char* top : {"platform", "pairwelld", "hearthd", "cloudsyncd", "tools"}) {
    for (const auto& entry : fs::recursive_directory_iterator(root / top)) {
      const auto extension = entry.path().extension();
      if (extension != ".cpp" && extension != ".hpp") continue;
      const std::string path = fs::relative(entry.path(), root).string();
      std::ifstream file(entry.path());
      for (std::string text; std::getline(file, text);) {
        std::smatch match;
        if (!std::regex_search(text, match, line)) continue;
        ++seen;
        EXPECT_TRUE(isAllowed(path, match[1])) << path << " includes " << match[1];
      }
    }
  }
  EXPECT_GT(seen, 100);
}

}  // namespace
