#include "platform/linux/ReplicaFileCloudStore.hpp"

#include "platform/linux/SettingsDocument.hpp"
#include "tests/linux/files/World.hpp"

namespace platform::linux_ {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

struct ReplicaFileCloudStoreTest : World {
  struct Listener {
    void changed(const Notification& notification) { seen.push_back(describe(*notification.userInfo)); }
    std::vector<std::string> seen;
  };
  ReplicaFileCloudStoreTest() {
    device.centre.addObserver(listener, &Listener::changed, CloudStore::externalChangeNotification,
                              static_cast<CloudStore*>(store.get()));
  }
  std::shared_ptr<ReplicaFileCloudStore> open(WorkQueue* delivery) {
    return ReplicaFileCloudStore::create(files, delivery, device.centre, device.manualClock, path);
  }
  std::vector<std::string> announced() {
    deliver();
    return std::exchange(listener->seen, {});
  }
  std::string entry(const std::string& key) {
    std::string problem;
    return describe(settingsValues(*decodeSettings(files.bytes(path), problem)).at(key));
  }

  const std::shared_ptr<ReplicaFileCloudStore> store = open(device.delivery.get());
  const std::shared_ptr<ReplicaFileCloudStore> neighbour = open(nullptr);
  const std::shared_ptr<Listener> listener = std::make_shared<Listener>();
};

TEST_F(ReplicaFileCloudStoreTest, OutsideChangeIsAnnouncedOnceAndAnOwnOneNever) {
  EXPECT_FALSE(store->boolForKey("never"));
  store->setValue(std::nullopt, "never");
  EXPECT_TRUE(device.delivery->isEmpty()) << "an echo gives nobody work";
  store->setValue(true, "flag");
  EXPECT_THAT(announced(), IsEmpty());
  neighbour->setValue(5.5, "end");
  neighbour->setValue(false, "flag");
  store->setValue(1, "own");
  EXPECT_FALSE(store->boolForKey("flag"));
  EXPECT_THAT(listener->seen, IsEmpty()) << "not from inside a write or a read";
  EXPECT_THAT(announced(), ElementsAre(R"(["ChangeReason": 0, "ChangedKeys": ["end", "flag"]])"));
  EXPECT_THAT(announced(), IsEmpty());
  EXPECT_EQ(describe(store->dictionaryRepresentation()), R"(["end": 5.5, "flag": false, "own": 1])");
}

TEST_F(ReplicaFileCloudStoreTest, ReasonsInTheFileAreAnnouncedOnceAndEvenWithoutAKey) {
  const auto announce = [&](int reason, int sequence) {
    ASSERT_TRUE(SettingsFile::create(files, path)->update([&](Dictionary& whole) {
      whole["reason"] = reason;
      whole["reasonSequence"] = sequence;
      return true;
    }));
  };
  announce(3, 1);
  EXPECT_THAT(announced(), ElementsAre(R"(["ChangeReason": 3, "ChangedKeys": []])"));
  neighbour->setValue(1, "a");
  EXPECT_THAT(announced(), ElementsAre(R"(["ChangeReason": 0, "ChangedKeys": ["a"]])"));
  neighbour->setValue(2, "a");
  announce(1, 2);
  EXPECT_THAT(announced(), ElementsAre(R"(["ChangeReason": 1, "ChangedKeys": ["a"]])"));
  neighbour->setValue(3, "a");
  announce(2, 3);
  EXPECT_THAT(announced(), ElementsAre(R"(["ChangeReason": 2, "ChangedKeys": []])",
                                       R"(["ChangeReason": 0, "ChangedKeys": ["a"]])"));
}

TEST_F(ReplicaFileCloudStoreTest, NeitherAnEchoNorWaitingForTheFileChangesAStamp) {
  neighbour->setValue(true, "flag");
  const std::string before = entry("flag");
  device.manualClock.time += Time(60);
  EXPECT_TRUE(store->boolForKey("flag"));
  store->setValue(true, "flag");
  EXPECT_EQ(entry("flag"), before) << "of a typed read";
  store->setValue(1, "own");
  device.manualClock.time += Time(10);
  store->setValue(1, "own");
  device.manualClock.time += Time(0.001);
  store->setValue(1, "other");
  files.onLock = [this] { device.manualClock.time += Time(1); };
  store->setValue(5.5, "end");
  for (const char* key : {"other", "end"})
    EXPECT_THAT(entry(key), HasSubstr(R"("time": 1000070001000)")) << "neither prolongs nor parts a burst";
}

TEST_F(ReplicaFileCloudStoreTest, FailedWriteIsNotDurableAndNotRemembered) {
  EXPECT_TRUE(store->synchronise());
  files.failure = ENOSPC;
  files.failFrom = files.calls + 4;
  store->setValue(true, "flag");
  files.failFrom = std::numeric_limits<int>::max();
  EXPECT_FALSE(store->synchronise());
  EXPECT_THAT(logged(), ElementsAre(HasSubstr("flag cannot be stored: No space left on device")));
  store->setValue(true, "flag");
  EXPECT_TRUE(store->synchronise());
  files.powerCut();
  EXPECT_TRUE(open(nullptr)->boolForKey("flag")) << "no echo of what was never written";
}

}  // namespace
}  // namespace platform::linux_
