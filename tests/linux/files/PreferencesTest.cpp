#include "platform/linux/FileRadixController.hpp"
#include "platform/linux/FileUserPreferences.hpp"
#include "tests/linux/files/World.hpp"

namespace platform::linux_ {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

struct Recorder : KeyObserver {
  void observeValue(const std::optional<std::string>& key, const void*) override {
    seen.push_back(*key);
    if (onChange) onChange();
  }
  std::vector<std::string> take() { return std::exchange(seen, {}); }
  std::vector<std::string> seen;
  std::function<void()> onChange;
};

struct PreferencesTest : World {
  PreferencesTest() {
    for (const char* key : {"a", "b", "c"}) store->addObserver(observer, key);
  }
  const std::shared_ptr<FileUserPreferences> store =
      FileUserPreferences::create(files, device.delivery.get(), path);
  const std::shared_ptr<FileUserPreferences> neighbour = FileUserPreferences::create(files, nullptr, path);
  const std::shared_ptr<Recorder> observer = std::make_shared<Recorder>();
};

TEST_F(PreferencesTest, OutsideChangeIsReportedOnceWithExactlyTheKeysThatDiffer) {
  for (const char* key : {"a", "b", "c"}) neighbour->setValue(0, key);
  deliver();
  EXPECT_THAT(observer->take(), ElementsAre("a", "b", "c"));
  neighbour->setValue(std::nullopt, "c");
  neighbour->setValue(std::numeric_limits<double>::quiet_NaN(), "a");
  neighbour->setValue(1, "b");
  neighbour->setValue(0, "b");
  EXPECT_EQ(store->doubleForKey("c"), 0.0) << "a read in between takes nothing from the report";
  EXPECT_THAT(observer->take(), IsEmpty());
  deliver();
  EXPECT_THAT(observer->take(), ElementsAre("a", "c"));
  files.put(path, files.bytes(path));
  deliver();
  EXPECT_THAT(observer->take(), IsEmpty()) << "a not-a-number is itself";
}

TEST_F(PreferencesTest, ForeignChangeFirstMetInAnOwnWriteIsReportedLaterAndOnce) {
  neighbour->setValue(1, "a");
  neighbour->setValue(1, "b");
  files.onFolderSync = [&] { files.deliverEvents(); };
  store->setValue(2, "b");
  files.onFolderSync = nullptr;
  EXPECT_THAT(observer->take(), ElementsAre("b")) << "the own one, from inside the write";
  device.runAll();
  EXPECT_THAT(observer->take(), ElementsAre("a")) << "without any event";
  deliver();
  EXPECT_THAT(observer->take(), IsEmpty());
  EXPECT_EQ(neighbour->doubleForKey("b"), 2.0);
  files.onFolderSync = [&] {
    files.put(path, R"({"values": {"a": 3, "b": 3}})");
    files.unreadable.insert(path);
    files.deliverEvents();
  };
  store->setValue(3, "b");
  files.onFolderSync = nullptr;
  device.runAll();
  EXPECT_THAT(observer->take(), ElementsAre("b"));
  files.unreadable.clear();
  EXPECT_EQ(store->doubleForKey("a"), 3.0);
  device.runAll();
  EXPECT_THAT(observer->take(), ElementsAre("a")) << "its event came while it could not be read";
}

TEST_F(PreferencesTest, ObserverThatHasLeftIsNotCalled) {
  const auto second = std::make_shared<Recorder>();
  store->addObserver(second, "a");
  observer->onChange = [&] { store->removeObserver(second.get(), "a"); };
  for (const char* key : {"a", "not observed"}) store->setValue(1, key);
  EXPECT_THAT(second->take(), IsEmpty()) << "removed by the one before it";
  auto third = std::make_shared<Recorder>();
  store->addObserver(third, "b");
  third.reset();
  store->setValue(1, "b");
  EXPECT_THAT(observer->take(), ElementsAre("a", "b")) << "own writes, at once";
  deliver();
  EXPECT_THAT(observer->take(), IsEmpty()) << "which are no outside changes";
}

TEST_F(PreferencesTest, FailuresAreLoggedAndTheOldContentsStay) {
  store->setValue(1, "a");
  observer->take();
  files.failure = ENOSPC;
  files.failFrom = files.calls + 5;
  store->setValue(2, "a");
  files.failFrom = std::numeric_limits<int>::max();
  EXPECT_THAT(logged(), ElementsAre(HasSubstr("a cannot be stored: No space left on device")));
  EXPECT_THAT(observer->take(), IsEmpty());
  EXPECT_EQ(store->doubleForKey("a"), 1.0);

  neighbour->setValue(3, "a");
  files.unreadable.insert(path);
  for (int read = 0; read < 2; ++read) EXPECT_EQ(store->doubleForKey("a"), 1.0);
  EXPECT_THAT(logged(), ElementsAre(HasSubstr(path + ": cannot be read: Permission denied")));
  FileRadixController root(files, path);
  EXPECT_EQ(root.readPrefKeys({"a"}).error(), std::errc::permission_denied);
  EXPECT_EQ(root.writePrefKey("a", 4).error(), std::errc::permission_denied);
  files.unreadable.clear();
  EXPECT_EQ(store->doubleForKey("a"), 3.0);
  ASSERT_TRUE(root.writePrefKey("b", true));
  ASSERT_TRUE(root.writePrefKey("a", nullptr));
  EXPECT_EQ(root.readPrefKeys({"a", "b"}).value(), (Dictionary{{"b", true}}));
}

}  // namespace
}  // namespace platform::linux_
