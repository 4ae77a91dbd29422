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

TEST(CloudReplicaTest, EchoKeepsItsPlaceEvenIfANewerEntryHasArrived) {
  Device ours("ours"), theirs("theirs");
  theirs.switchOn(5000);
  ours.exchange(theirs);
  for (const char* key : {"flag", "flagExpiration"}) ours.read(key);
  theirs.now += Time(10);
  theirs.switchOff();
  ours.exchange(theirs);
  ours.now += Time(20);
  EXPECT_FALSE(ours.write("flag", true)) << "what it read before";
  EXPECT_FALSE(ours.write("flagExpiration", 5000.0));
  EXPECT_EQ(ours.values(), R"(["flag": false])");
  EXPECT_TRUE(ours.write("other", 1));
  EXPECT_FALSE(ours.write("flag", true)) << "behind news of another key, too";

  ours.read("never");
  EXPECT_FALSE(ours.write("never", std::nullopt));
  EXPECT_TRUE(ours.write("never", false)) << "an absent entry equals only a removal";
  ours.now += Time(1);
  EXPECT_FALSE(ours.write("never", false)) << "what it wrote before";
  EXPECT_TRUE(ours.write("never", 0)) << "not the same in the file";
  EXPECT_TRUE(ours.write("unread", std::nullopt)) << "nothing known";
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
  device.write("flag", false);
  const CloudStamp second = device.stamp("flag");
  EXPECT_GT(second, first) << "a second value";
  device.disk = Time(5);
  device.now += Time(0.026);
  device.write("third", 2);
  EXPECT_GT(device.stamp("third"), second);
  device.write("fourth", 2);
  EXPECT_EQ(device.stamp("fourth"), device.stamp("third")) << "a slow disk parts nothing";

  Device neighbour("d");
  neighbour.entries = device.entries;
  neighbour.now = Time(10);
  neighbour.write("flag", true);
  EXPECT_GT(neighbour.stamp("flag"), device.stamp("third")) << "though its clock is behind";
  device.entries = neighbour.entries;
  EXPECT_TRUE(device.write("flag", 7)) << "not lost on what has overtaken the burst";
  EXPECT_EQ(device.values(), R"(["flag": 7, "fourth": 2, "third": 2])");
}

TEST(CloudReplicaTest, ExpiryRanksRightAfterTheSwitchThatItEnds) {
  Device away("away"), home("home");
  home.switchOn(5000);
  away.exchange(home);
  home.now = Time(3000);
  home.switchOff();
  home.now += Time(60);
  home.switchOn(9000);

  away.now = Time(4999.2);  // within the second
  away.switchOff();
  EXPECT_EQ(away.stamp("flag"), (CloudStamp{1'000'000'000, 1}));
  EXPECT_EQ(away.stamp("flagExpiration"), away.stamp("flag"));
  away.write("other", 1);
  EXPECT_EQ(away.stamp("other").microseconds, 4'999'200'000) << "a burst of its own";
  away.exchange(home);
  EXPECT_EQ(cloudValues(away.entries).at("flagExpiration"), Value(9000.0)) << "the newest period stands";

  // Begun anew between the two writes of an expiry.
  away.now = Time(9000);
  away.write("flag", false);
  home.now = Time(9000);
  home.switchOff();
  home.switchOn(12000);
  away.exchange(home);
  EXPECT_FALSE(away.write("flagExpiration", std::nullopt));
  EXPECT_EQ(away.values(), R"(["flag": true, "flagExpiration": 12000.0, "other": 1])");

  // A person's "off" before the end is one with the stamp of now.
  for (const char* key : {"flag", "flagExpiration"}) away.read(key);
  away.switchOff();
  EXPECT_EQ(away.stamp("flag").tick, 0);
  home.exchange(away);
  EXPECT_EQ(home.values(), R"(["flag": false, "other": 1])");

  // An expiry long past does not keep a later removal of an end from being news.
  home.switchOn(home.now.count());
  home.switchOff();
  away.now = home.now + Time(100);
  away.exchange(home);
  away.switchOn(20000);
  home.exchange(away);
  for (const char* key : {"flag", "flagExpiration"}) home.read(key);
  home.now = away.now + Time(1);
  home.switchOn(20000);  // echoes
  away.now += Time(2);
  away.write("flag", false);
  mergeCloudEntries(away.entries, home.entries, home.now);
  home.read("flag");
  EXPECT_TRUE(home.write("flagExpiration", std::nullopt));
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
    for (const char* key : {"flag", "flagExpiration"}) third.read(key);
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

TEST(CloudReplicaTest, ASlowSwitchKeepsItsPairTogetherWhateverItsFollowersWrite) {
  Device slow("slow"), follower("follower");
  slow.write("flag", true);
  follower.exchange(slow);
  follower.write("flagExpiration", 9000.0);
  slow.exchange(follower);
  slow.write("flagExpiration", 5000.0);
  follower.exchange(slow);
  EXPECT_EQ(follower.values(), R"(["flag": true, "flagExpiration": 5000.0])");
  EXPECT_EQ(follower.stamp("flagExpiration"), follower.stamp("flag"));

  slow.now += Time(1);
  slow.write("flag", false);
  follower.exchange(slow);
  follower.now = Time(5000);
  follower.switchOff();  // its end, there
  slow.exchange(follower);
  slow.write("flagExpiration", std::nullopt);
  EXPECT_EQ(slow.entries, follower.entries);
}

TEST(CloudReplicaTest, AnExpiryEndsNoSwitchOfTheSameMomentAndIsNoEcho) {
  Device loser("a"), winner("b"), third("c");
  third.now = Time(900);
  third.write("flag", false);
  loser.switchOn(2000);
  winner.switchOn(9000);
  third.exchange(loser);
  loser.now = third.now = Time(3000);
  EXPECT_TRUE(third.write("flag", false)) << "though it last wrote the same";
  third.write("flagExpiration", std::nullopt);
  loser.switchOff();
  EXPECT_EQ(loser.entries, third.entries);
  third.exchange(winner);
  EXPECT_EQ(third.values(), R"(["flag": true, "flagExpiration": 9000.0])");
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
  for (const char* key : {"flag", "flagExpiration"}) ahead.read(key);
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
