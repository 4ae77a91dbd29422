#include "platform/linux/CloudReplica.hpp"

#include <gtest/gtest.h>

#include <random>

#include "platform/linux/SettingsDocument.hpp"

namespace platform::linux_ {
namespace {

// One process of a device: its replica, its clock, its bursts.
struct Device {
  explicit Device(std::string name_) : name(std::move(name_)) {}

  bool write(const std::string& key, std::optional<Value> value) {
    std::optional<std::optional<Value>> known;
    if (lastKnown.contains(key)) known.emplace(lastKnown[key]);
    const bool news = bursts.write(entries, {key, value, known, now, name});
    now += disk;
    if (news) bursts.finished(now);
    lastKnown[key] = value;
    return news;
  }
  void read(const std::string& key) {
    const auto entry = CloudEntry::find(entries, key);
    lastKnown[key] = entry ? entry->value : std::nullopt;
  }
  void readPair() {
    for (const char* key : {"flag", "flagExpiration"}) read(key);
  }
  void switchOn(double end) {
    write("flag", true);
    write("flagExpiration", end);
  }
  void switchOff() {
    write("flag", false);
    write("flagExpiration", std::nullopt);
  }
  CloudStamp stamp(const std::string& key) { return CloudEntry::find(entries, key)->stamp; }
  std::string values() const { return describe(cloudValues(entries)); }
  void exchange(Device& other) {
    mergeCloudEntries(other.entries, entries, now);
    mergeCloudEntries(entries, other.entries, now);
    EXPECT_EQ(entries, other.entries);
  }

  std::string name;
  Time now{1000}, disk{0};  // the clock, and how long a write takes
  Dictionary entries;
  CloudBursts bursts;
  std::map<std::string, std::optional<Value>> lastKnown;
};

TEST(CloudReplicaTest, AnEchoIsWhatEqualsTheValueThatWasLastReadOrWritten) {
  Device device("d");
  device.read("key");
  EXPECT_FALSE(device.write("key", std::nullopt));
  EXPECT_TRUE(device.write("key", false)) << "an absent entry equals only a removal";
  device.now += Time(1);
  EXPECT_FALSE(device.write("key", false)) << "what it wrote before";
  EXPECT_TRUE(device.write("other", 1));
  EXPECT_FALSE(device.write("key", false)) << "behind news of another key, too";
  EXPECT_TRUE(device.write("key", 0)) << "not the same in the file";
  EXPECT_TRUE(device.write("unread", std::nullopt)) << "nothing known";
}

TEST(CloudReplicaTest, WhatIsWrittenTogetherSharesOneTimestamp) {
  Device device("d");
  device.read("flagExpiration");
  device.write("flag", true);
  const CloudStamp first = device.stamp("flag");
  device.now += Time(0.024);
  EXPECT_TRUE(device.write("flagExpiration", std::nullopt)) << "no echo behind its flag";
  EXPECT_EQ(device.stamp("flagExpiration"), first);
  device.now += Time(0.024);
  device.write("third", 1);
  EXPECT_EQ(device.stamp("third"), first) << "the quiet is that between two writes";
  device.disk = Time(5);
  device.now += Time(0.026);
  device.write("third", 2);
  EXPECT_GT(device.stamp("third"), first);
  device.write("fourth", 2);
  EXPECT_EQ(device.stamp("fourth"), device.stamp("third")) << "a slow disk parts nothing";

  Device neighbour("d");
  neighbour.entries = device.entries;
  neighbour.now = Time(10);
  neighbour.write("flag", true);
  EXPECT_GT(neighbour.stamp("flag"), device.stamp("third")) << "though its clock is behind";
}

TEST(CloudReplicaTest, ExpiryRanksRightAfterTheSwitchThatItEnds) {
  Device away("away"), home("home");
  home.switchOn(5000);
  away.exchange(home);
  away.now = Time(4999.2);  // within the second
  away.switchOff();
  EXPECT_EQ(away.stamp("flag"), (CloudStamp{1'000'000'000, 1}));
  EXPECT_EQ(away.stamp("flagExpiration"), away.stamp("flag"));

  // One long past does not keep a later removal of an end from being news.
  home.now = Time(5000);
  away.exchange(home);
  home.readPair();
  home.switchOn(9000);
  away.exchange(home);
  away.readPair();
  away.now = Time(5001);
  away.switchOn(9000);  // echoes
  home.now = Time(5002);
  home.write("flag", false);
  EXPECT_EQ(home.stamp("flag").tick, 0) << "a person's, before the end";
  away.exchange(home);
  away.read("flag");
  EXPECT_TRUE(away.write("flagExpiration", std::nullopt));
  away.write("other", 1);
  EXPECT_GT(away.stamp("other").microseconds, 5'000'000'000) << "a burst of its own";
}

TEST(CloudReplicaTest, ASwitchThatIsOvertakenMidwayLosesBothItsKeys) {
  Device ours("ours"), theirs("theirs");
  theirs.now += Time(0.01);
  theirs.switchOn(7000);
  ours.write("flag", true);
  mergeCloudEntries(theirs.entries, ours.entries, ours.now);
  EXPECT_FALSE(ours.write("flagExpiration", 5000.0));
  EXPECT_EQ(ours.entries, theirs.entries);
}

TEST(CloudReplicaTest, AFollowerOfHalfASwitchOutranksNothingNewer) {
  for (const bool isOn : {true, false}) {
    Device cut("cut"), third("third"), home("home");
    if (!isOn) cut.switchOn(5000);
    third.exchange(cut);
    third.readPair();
    cut.now += Time(1);
    cut.write("flag", isOn);
    third.exchange(cut);
    home.now += Time(10);
    home.switchOn(7000);
    third.now += Time(20);
    third.read("flag");
    EXPECT_TRUE(third.write("flagExpiration", isOn ? std::optional<Value>(9000.0) : std::nullopt));
    third.exchange(home);
    EXPECT_EQ(third.values(), R"(["flag": true, "flagExpiration": 7000.0])");
    EXPECT_FALSE(third.write("flagExpiration", std::nullopt)) << "its flag has been overtaken";
  }
}

TEST(CloudReplicaTest, AClockThatIsYearsAheadIsOverruledAndNotFollowed) {
  Device ahead("ahead"), sane("sane");
  ahead.now = Time(1e8);
  ahead.switchOn(2e8);
  sane.exchange(ahead);
  sane.write("other", 1);
  EXPECT_EQ(sane.stamp("other").microseconds, 1'000'000'000);
  sane.now += Time(1);
  sane.switchOff();
  EXPECT_EQ(sane.stamp("flagExpiration"), sane.stamp("flag"));
  ahead.exchange(sane);
  EXPECT_EQ(ahead.values(), R"(["flag": false, "other": 1])");
  ahead.readPair();
  ahead.now = sane.now = Time(2000);  // mended
  ahead.switchOn(5000);
  sane.exchange(ahead);
  EXPECT_EQ(sane.values(), R"(["flag": true, "flagExpiration": 5000.0, "other": 1])");
  ahead.now = Time(1e11);
  ahead.write("other", 2);
  ahead.now = sane.now;
  ahead.write("other", 3);
  EXPECT_EQ(ahead.stamp("other").microseconds, 2'000'000'000) << "what no device accepts bars nothing";
}

TEST(CloudReplicaTest, MergingTakesTheGreaterInWhateverOrder) {
  std::mt19937 random(7);
  const auto below = [&](int limit) { return static_cast<int>(random() % static_cast<unsigned>(limit)); };
  const auto merged = [](Dictionary into, const Dictionary& other) {
    mergeCloudEntries(other, into, Time(1));
    return into;
  };
  for (int round = 0; round < 1000; ++round) {
    Dictionary replicas[3];
    for (Dictionary& replica : replicas) {
      const std::optional<Value> value = below(3) == 0 ? std::nullopt : std::optional<Value>(below(3));
      const std::int64_t time = below(3) == 0 ? std::int64_t{1} << 60 : below(2);
      if (below(4) > 0) replica["a"] = CloudEntry{value, {time, below(2)}, "d"}.toValue();
    }
    const auto& [a, b, c] = replicas;
    Dictionary both = merged(a, b);
    ASSERT_EQ(both, merged(b, a));
    ASSERT_EQ(merged(both, c), merged(a, merged(b, c)));
    ASSERT_FALSE(mergeCloudEntries(b, both, Time(1))) << "nothing new the second time";
  }
}

TEST(CloudReplicaTest, WhatIsNoEntryIsSkipped) {
  const Dictionary good{{"value", 1}, {"time", 5}, {"tick", 0}, {"device", "d"}};
  for (const auto& [name, value] : Dictionary{{"time", -1}, {"tick", "0"}, {"removed", true}}) {
    Dictionary fields = good;
    fields.insert_or_assign(name, value);
    EXPECT_EQ(cloudValues({{"a", good}, {"b", fields}}), (Dictionary{{"a", 1}})) << name;
  }
}

}  // namespace
}  // namespace platform::linux_
