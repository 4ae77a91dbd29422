// Real files, processes and threads.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/linux/LinuxFileSystem.hpp"
#include "platform/linux/SettingsDocument.hpp"
#include "platform/linux/SettingsFile.hpp"
#include "tests/fakes/RealFiles.hpp"

namespace platform::linux_ {
namespace {

TEST(SharedFilesTest, WritersInTwoProcessesAndTwoThreadsLoseNothing) {
  const fakes::TemporaryFolder folder;
  const std::string path = folder.path + "/var/settings/store.json";
  LinuxFileSystem files(nullptr);
  const auto writeKeys = [&](const std::string& prefix) {
    const auto file = SettingsFile::create(files, path);
    for (int number = 0; number < 25; ++number) {
      if (!file->setValue(prefix + std::to_string(number), number)) std::abort();
    }
  };
  const pid_t child = ::fork();
  if (child == 0) {
    writeKeys("child");
    ::_exit(0);
  }
  std::thread second(writeKeys, "second");
  writeKeys("first");
  second.join();
  int status = -1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
  EXPECT_EQ(settingsValues(*SettingsFile::create(files, path)->contents()).size(), 75u);
  EXPECT_THAT(files.list(folder.path + "/var/settings").value(),
              testing::ElementsAre("store.json", "store.json.lock"));
}

}  // namespace
}  // namespace platform::linux_
