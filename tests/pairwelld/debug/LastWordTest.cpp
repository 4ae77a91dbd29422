// A client's last word holds, however its calls, the writes and the notices of them fall over each other.
#include <random>

#include "tests/pairwelld/World.hpp"

namespace pairwell {
namespace {

// Calls come between the work items and, from a thread of their own, at any read or effect inside one.
struct Device : World {
  explicit Device(std::uint64_t seed) : random(seed) {
    platform.seed(seed);
    manager = makeDebugManager();
    for (bool enabled : {true, false}) say(enabled);
    run();
  }

  void speak(int words) {
    budget = words;
    platform.effects.onMoment = [this] { maybeSpeak(6); };
    while (budget > 0) {
      maybeSpeak(3);
      platform.runOne();
    }
    platform.effects.onMoment = nullptr;
    run();
  }

  bool lastWord = false;
  double length = 345600;
  std::shared_ptr<DebugManager> manager;

 private:
  int draw(int count) { return std::uniform_int_distribution<int>(0, count - 1)(random); }
  void maybeSpeak(int oneIn) {
    if (budget <= 0 || draw(oneIn) != 0) return;
    --budget;
    if (draw(4) == 0) return replaceLength();
    for (int burst = draw(3); burst >= 0; --burst) say(draw(2) == 0);
  }
  // A length is for the next period, so one that runs is ended first.
  void replaceLength() {
    say(false);
    length = 60 + draw(1000);
    if (draw(2) == 0) {
      platform.user->changeFromElsewhere(overrideKey, length);
    } else {
      platform.user->setValue(length, overrideKey);
    }
    say(true);
  }
  void say(bool enabled) {
    lastWord = enabled;
    manager->setAudioAccessoryLimitedLoggingEnabled(enabled);
  }

  std::mt19937_64 random;
  int budget = 0;
};

TEST(LastWordTest, HoldsInEveryOrder) {
  for (std::uint64_t seed = 1; seed <= 1000 && !testing::Test::HasFailure(); ++seed) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    Device device(seed);
    device.speak(12);
    const double end = device.now() + device.length;
    const bool on = device.lastWord;
    EXPECT_EQ(device.manager->audioAccessoryLimitedLoggingEnabled(), on);
    EXPECT_EQ(device.platform.cloud->value(flagKey), Value(on));
    EXPECT_EQ(device.platform.radix.contents.at(flagKey), Value(on));
    EXPECT_EQ(device.platform.cloud->value(endKey), on ? std::optional<Value>(end) : std::nullopt);
    EXPECT_EQ(device.platform.streams.nextDue(), on ? std::optional(platform::Time(end)) : std::nullopt);
    EXPECT_FALSE(device.platform.runOne()) << "something still moves";
  }
}

}  // namespace
}  // namespace pairwell
