// Real files, processes and threads.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <condition_variable>
#include <cstdlib>
#include <filesystem>
#include <mutex>
#include <thread>

#include "platform/linux/FileUserPreferences.hpp"
#include "platform/linux/LinuxFileSystem.hpp"
#include "platform/linux/SettingsDocument.hpp"

namespace platform::linux_ {
namespace {

class SharedFilesTest : public testing::Test {
 protected:
  SharedFilesTest() {
    std::string name = std::filesystem::temp_directory_path() / "filesXXXXXX";
    root = ::mkdtemp(name.data());
    path = root + "/var/settings/store.json";
  }
  ~SharedFilesTest() override { std::filesystem::remove_all(root); }

  void writeKeys(const std::string& prefix) {
    const auto file = SettingsFile::create(files, path);
    for (int number = 0; number < 25; ++number) {
      if (!file->setValue(prefix + std::to_string(number), number)) std::abort();
    }
  }

  std::string root, path;
  LinuxFileSystem files{nullptr};
};

TEST_F(SharedFilesTest, WritersInTwoProcessesAndTwoThreadsLoseNothing) {
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    writeKeys("child");
    ::_exit(0);
  }
  std::thread second([this] { writeKeys("second"); });
  writeKeys("first");
  second.join();
  int status = -1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
  const auto document = SettingsFile::create(files, path)->contents();
  EXPECT_EQ(settingsValues(*document).size(), 75u);
  EXPECT_THAT(files.list(root + "/var/settings").value(),
              testing::ElementsAre("store.json", "store.json.lock"));
}

// On the delivery thread.
struct Counter : KeyObserver {
  void observeValue(const std::optional<std::string>& key, const void*) override {
    std::lock_guard lock(mutex);
    ++counts[*key];
    changed.notify_all();
  }
  bool waitFor(const std::string& key) {
    std::unique_lock lock(mutex);
    return changed.wait_for(lock, std::chrono::seconds(20), [&] { return counts.contains(key); });
  }
  std::mutex mutex;
  std::condition_variable changed;
  std::map<std::string, int> counts;
};

TEST_F(SharedFilesTest, NeighboursWritesAreReportedOnceWhileOneWritesOneself) {
  EventLoop loop;
  LinuxFileSystem watched(&loop);
  const auto counter = std::make_shared<Counter>();
  std::thread delivery([&] { loop.run(); });
  auto store = FileUserPreferences::create(watched, &loop, path);
  store->addObserver(counter, "last");
  for (int number = 0; number < 25; ++number) store->addObserver(counter, "other" + std::to_string(number));
  std::thread neighbour([this] { writeKeys("other"); });
  for (int number = 0; number < 25; ++number) store->setValue(number, "own" + std::to_string(number));
  neighbour.join();
  ASSERT_TRUE(SettingsFile::create(files, path)->setValue("last", true));
  EXPECT_TRUE(counter->waitFor("last"));
  store.reset();
  loop.stop();
  delivery.join();
  EXPECT_EQ(counter->counts.size(), 26u);
  for (const auto& [key, count] : counter->counts) EXPECT_EQ(count, 1) << key;
}

}  // namespace
}  // namespace platform::linux_
