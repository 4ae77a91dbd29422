#include "platform/linux/SettingsFile.hpp"

#include <sys/wait.h>
#include <unistd.h>

#include "platform/linux/LinuxFileSystem.hpp"
#include "platform/linux/SettingsDocument.hpp"
#include "tests/fakes/RealFiles.hpp"
#include "tests/linux/files/World.hpp"

namespace platform::linux_ {
namespace {

using testing::AllOf;
using testing::ElementsAre;
using testing::HasSubstr;

struct SettingsFileTest : World {
  std::shared_ptr<SettingsFile> open() { return SettingsFile::create(files, path); }
  static Dictionary stored(SettingsFile& file) { return settingsValues(*file.contents()); }
};

TEST_F(SettingsFileTest, DamageIsMovedAsideWhileTheLastGoodContentsStayInForce) {
  const std::pair<std::string, const char*> rows[] = {
      {"", "line 1, column 1"},
      {"{\n  \"values\": {\"a\": 1", "line 2, column"},
      {"{\n\"values\": 5}", "line 2: \"values\""},
      {"{\"values\": {\"a\": 3},\n\"checksum\": \"00000000\"}", "line 2: the contents do not match"},
      {std::string(SettingsFile::sizeLimit + 1, ' '), "larger than"},
  };
  const auto file = open();
  ASSERT_TRUE(file->setValue("a", 1));
  int number = 0;
  for (const auto& [text, place] : rows) {
    files.put(path, text);
    EXPECT_EQ(stored(*file), (Dictionary{{"a", 1}}));
    EXPECT_EQ(stored(*file), (Dictionary{{"a", 1}})) << "with no file in its place";
    const std::string aside = path + ".damaged-" + std::to_string(++number);
    EXPECT_EQ(files.bytes(aside), text);
    EXPECT_THAT(logged(), ElementsAre(AllOf(HasSubstr(path + ": "), HasSubstr(place), HasSubstr(aside),
                                            HasSubstr("remove its checksum line"))));
  }
  ASSERT_TRUE(file->setValue("b", 2));
  EXPECT_EQ(stored(*open()), (Dictionary{{"a", 1}, {"b", 2}})) << "another process, from the file";

  files.put(path, "?");
  ASSERT_TRUE(file->setValue("c", 3)) << "first met by a write";
  EXPECT_EQ(stored(*open()), (Dictionary{{"a", 1}, {"b", 2}, {"c", 3}}));
}

TEST_F(SettingsFileTest, DamageThatCannotBeMovedIsNotOverwritten) {
  const auto file = open();
  ASSERT_TRUE(file->setValue("good", 1));
  files.put(path, "?");
  files.immovable.insert(path);
  EXPECT_EQ(stored(*file), (Dictionary{{"good", 1}}));
  EXPECT_EQ(stored(*file), (Dictionary{{"good", 1}}));
  EXPECT_EQ(logged().size(), 1u) << "not at each read";
  EXPECT_EQ(file->setValue("a", 1).error(), Outcome::malformedFile);
  EXPECT_EQ(files.bytes(path), "?");
  files.immovable.clear();
  EXPECT_EQ(stored(*open()), Dictionary{});
  EXPECT_EQ(stored(*file), (Dictionary{{"good", 1}})) << "though another process has moved it";
}

TEST_F(SettingsFileTest, HandEditIsWelcomeAndUnknownFieldsSurviveARewrite) {
  files.put(path, R"({"note": {"by": ["me"]}, "values": {"a": 1, "later": {"x": null}}})");
  const auto file = open();
  ASSERT_TRUE(file->setValue("a", std::nullopt));
  ASSERT_TRUE(file->setValue("infinite", std::numeric_limits<double>::infinity()));
  std::string problem;
  const auto document = decodeSettings(files.bytes(path), problem);
  ASSERT_TRUE(document) << problem;
  EXPECT_EQ(describe(*document),
            R"(["note": ["by": ["me"]], "values": ["infinite": inf, "later": ["x": null]]])");
  EXPECT_TRUE(logged().empty());
}

TEST_F(SettingsFileTest, WhatCouldNotBeReadBackIsNotWritten) {
  const auto file = open();
  ASSERT_TRUE(file->setValue("a", 1));
  const std::string before = files.bytes(path);
  Value deep = 1;
  for (int level = 0; level < 40; ++level) deep = List{deep};
  EXPECT_EQ(file->setValue("b", deep).error(), Outcome::tooLarge);
  EXPECT_EQ(file->setValue("b", std::string(SettingsFile::sizeLimit, 'x')).error(), Outcome::tooLarge);
  EXPECT_FALSE(file->update([](Dictionary& whole) {
    settingsValues(whole) = {{"\xff", 1}, {"\xfe", 2}};
    return true;
  })) << "two keys that print alike";
  EXPECT_EQ(files.bytes(path), before);
}

// Two objects on one file are two processes. The values' texts are of one size, and inodes come back at once.
TEST_F(SettingsFileTest, NeighboursWriteIsReadThoughItsEventsAreHeldBack) {
  const auto ours = open(), theirs = open();
  ours->startWatching(*device.delivery, [](const auto&, const auto&) {});
  for (int value = 10; value < 30; ++value) {
    ASSERT_TRUE(theirs->setValue("key", value));
    EXPECT_EQ(stored(*ours), (Dictionary{{"key", value}}));
  }
  files.put(path, R"({"values": {}})");
  EXPECT_EQ(stored(*ours), Dictionary{});
  for (int value = 1; value < 4; ++value) {
    ASSERT_TRUE(theirs->setValue("key", value));
    EXPECT_EQ(stored(*ours), (Dictionary{{"key", value}}));
    ASSERT_TRUE(files.remove(path) && files.syncFolder("/var/settings"));
    EXPECT_EQ(stored(*ours), Dictionary{}) << "a missing file is an empty one";
  }
  files.onFolderSync = [&] { files.put(path, R"({"values": {"key": 99}})"); };
  ASSERT_TRUE(ours->setValue("key", 5));
  EXPECT_EQ(stored(*ours), (Dictionary{{"key", 99}})) << "by who asks for no lock, right behind ours";
  files.onFolderSync = [&] {  // as long, and perhaps on our inode
    std::string other = R"({"values": {"key": 7}})";
    other.resize(files.bytes(path).size(), ' ');
    ASSERT_TRUE(files.remove(path));
    files.put(path, other);
  };
  ASSERT_TRUE(ours->setValue("key", 6));
  EXPECT_EQ(stored(*ours), (Dictionary{{"key", 7}}));
  files.onFolderSync = [&] { files.put(path, "?"); };
  ASSERT_TRUE(ours->setValue("key", 8));
  EXPECT_EQ(stored(*ours), (Dictionary{{"key", 8}})) << "what was acknowledged is in force";
}

// Cuts a write at every call that it makes; then its process ends, or loses its power, or tries again.
TEST_F(SettingsFileTest, CutAtAnyCallLeavesTheOldContentsOrTheNew) {
  enum End { killed, powerCut, retriedThenPowerCut };
  for (const bool first : {true, false}) {
    for (const End end : {killed, powerCut, retriedThenPowerCut}) {
      bool whole = false;
      for (int cut = 1; !whole; ++cut) {
        SCOPED_TRACE(testing::Message() << "first " << first << ", end " << end << ", call " << cut);
        fakes::MemoryFileSystem disk;
        const auto file = SettingsFile::create(disk, path);
        ASSERT_TRUE(first || file->setValue("a", "old"));
        disk.calls = 0;
        disk.failFrom = cut;
        bool told = file->setValue("a", "new").has_value();
        whole = disk.calls < cut;
        disk.failFrom = std::numeric_limits<int>::max();
        if (end == retriedThenPowerCut) told = file->setValue("a", "new").has_value();
        EXPECT_TRUE(told || end != retriedThenPowerCut);
        if (end != killed) disk.powerCut();
        const auto next = SettingsFile::create(disk, path);
        const Dictionary old = first ? Dictionary{} : Dictionary{{"a", "old"}};
        const Dictionary values = stored(*next);
        EXPECT_TRUE(values == (Dictionary{{"a", "new"}}) || (!told && values == old)) << describe(values);
        EXPECT_TRUE(next->setValue("b", 1));
        EXPECT_FALSE(disk.exists(path + ".damaged-1"));
      }
    }
  }
}

// Real files, processes and threads.
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
              ElementsAre("store.json", "store.json.lock"));
  EXPECT_TRUE(files.syncFolder("/proc")) << "where folders know no sync";
  EXPECT_FALSE(files.list(folder.path + "/none"));
}

}  // namespace
}  // namespace platform::linux_
