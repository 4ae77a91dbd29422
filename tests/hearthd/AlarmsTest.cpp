// What the alarms decide, by a clock that the tests set.
#include "hearthd/core/Alarms.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <string>
#include <vector>

#include "hearthd/core/Broker.hpp"
#include "hearthd/core/PendingEvents.hpp"
#include "hearthd/core/Restarts.hpp"
#include "platform/ClientLimits.hpp"

namespace hearth {
namespace {

using platform::Date;
using platform::Time;
using testing::ElementsAre;
using testing::IsEmpty;

constexpr const char* stream = "com.kestrel.alarm";

Date at(double seconds) { return {static_cast<std::int64_t>(seconds * 1e9)}; }
EventKey key(const std::string& name, const std::string& job = "job") { return {job, stream, name}; }

// Wall clock and steady clock move together, unless the test sets one.
struct AlarmsTest : testing::Test {
  void advance(double seconds) {
    now.wall += Time(seconds);
    now.steady += Time(seconds);
  }
  std::vector<std::string> due() {
    std::vector<std::string> names;
    for (const Alarm& alarm : alarms.takeDue(now)) {
      names.push_back(alarm.key.name + "/" + std::to_string(alarm.generation));
    }
    return names;
  }
  // How long until takeDue() is to be asked again.
  double wait() {
    const Alarms::Next next = alarms.next(now);
    const double wall = next.wall ? (*next.wall - now.wall).count() : INFINITY;
    const double steady = next.steady ? (*next.steady - now.steady).count() : INFINITY;
    return std::max(std::min(wall, steady), 0.0);
  }
  // The job ends, and another run of it is there.
  void restart() {
    alarms.jobEnded("job");
    EXPECT_THAT(due(), IsEmpty()) << "nobody to deliver to";
    alarms.handlerInstalled("job", stream, now);
  }

  Alarms alarms;
  Moment now{Time(1000), Time(5)};
};

TEST_F(AlarmsTest, ComesOnceWhenDueAndAgainToTheNextRunUntilTaken) {
  alarms.set(key("a"), at(1010));
  EXPECT_EQ(wait(), INFINITY) << "nobody to deliver to";
  alarms.handlerInstalled("job", stream, now);
  alarms.set(key("b"), at(1011));
  EXPECT_EQ(wait(), 10) << "the earlier one";
  alarms.clear(key("b"));
  now.wall = Time(500);
  EXPECT_EQ(wait(), 510) << "the clock has been set";
  now.wall = Time(1009.5);
  EXPECT_THAT(due(), IsEmpty());
  advance(0.5);
  EXPECT_THAT(due(), ElementsAre("a/1"));
  EXPECT_THAT(due(), IsEmpty());

  restart();
  EXPECT_EQ(wait(), 1);
  advance(1);
  EXPECT_THAT(due(), ElementsAre("a/1"));
  EXPECT_FALSE(alarms.taken(key("a"), 0)) << "an earlier one of that name";
  EXPECT_TRUE(alarms.taken(key("a"), 1));
  restart();
  advance(5);
  EXPECT_THAT(due(), IsEmpty());
}

TEST_F(AlarmsTest, OverdueAtInstallWaitsASecondAndWhatTheStartRegistersCounts) {
  for (const char* name : {"kept", "cleared", "replaced"}) alarms.set(key(name), at(990));
  alarms.set(key("soon"), at(1000.25));
  alarms.set(key("other", "otherJob"), at(990));
  alarms.handlerInstalled("job", stream, now);
  EXPECT_THAT(due(), IsEmpty());
  alarms.clear(key("cleared"));
  alarms.set(key("replaced"), at(1060));
  advance(0.25);
  EXPECT_THAT(due(), ElementsAre("soon/4")) << "was not overdue, so it does not wait";
  now.wall -= Time(5);
  EXPECT_EQ(wait(), 0.75) << "setting the clock back does not stretch the wait";
  advance(0.75);
  EXPECT_THAT(due(), ElementsAre("kept/1"));
  advance(100);
  EXPECT_THAT(due(), ElementsAre("replaced/7"));
}

TEST_F(AlarmsTest, ReadsBackWhatItWroteWithGenerationsGoingOn) {
  alarms.set(key("a"), at(1));
  alarms.set(key("b", "otherJob"), {INT64_MIN});
  alarms.clear(key("c"));
  auto back = Alarms::fromValue(alarms.toValue());
  ASSERT_TRUE(back);
  EXPECT_EQ(back->toValue(), alarms.toValue());
  EXPECT_EQ(back->set(key("a", "third"), at(1)), 4);
  EXPECT_EQ(back->clearNamed("a"), 2u) << "of every job";

  const auto whole = *alarms.toValue().as<platform::Dictionary>();
  auto entry = *(*whole.at("alarms").as<platform::List>())[0].as<platform::Dictionary>();
  entry["date"] = "soon";
  const std::pair<const char*, platform::Value> bad[] = {
      {"lastGeneration", 0}, {"alarms", 1}, {"alarms", platform::List{entry}}};
  for (const auto& [name, value] : bad) {
    auto copy = whole;
    copy[name] = value;
    EXPECT_FALSE(Alarms::fromValue(copy)) << platform::describe(value);
  }
}

TEST(Broker, KnowsWhoWatchesUntilTheyLeave) {
  Broker broker;
  for (const auto& [watcher, name] : {std::pair(1u, "a"), {2u, "a"}, {1u, "b"}})
    EXPECT_TRUE(broker.watch(watcher, name));
  EXPECT_THAT(broker.watchers("a"), ElementsAre(1, 2));
  broker.remove(1);
  EXPECT_THAT(broker.watchers("a"), ElementsAre(2));
  EXPECT_THAT(broker.watchers("b"), IsEmpty());
  std::size_t most = 0;
  while (most <= platform::limits::watchedNames && broker.watch(3, std::to_string(most))) ++most;
  EXPECT_EQ(most, platform::limits::watchedNames);
  EXPECT_TRUE(broker.watch(3, "0")) << "watched already";
}

TEST(PendingEvents, WaitMergedForTheHandlerAndAgainForThatOfTheNextRun) {
  PendingEvents events;
  EXPECT_FALSE(events.add("job", stream, "a"));
  EXPECT_FALSE(events.add("job", stream, "a"));
  EXPECT_THAT(events.handlerInstalled("job", stream), ElementsAre("a"));
  EXPECT_TRUE(events.add("job", stream, "c"));
  events.jobEnded("job");
  EXPECT_FALSE(events.add("job", stream, "d"));
  EXPECT_THAT(events.handlerInstalled("job", stream), ElementsAre("d"));
}

TEST(Restarts, DelayGrowsToItsLimitUntilARunWasSound) {
  Restarts restarts;
  for (const int delay : {100, 200, 400, 800, 1600, 3200, 6400, 12800, 25600, 51200, 60000, 60000})
    EXPECT_EQ(restarts.delayAfter(std::chrono::milliseconds(5)).count(), delay);
  EXPECT_EQ(restarts.delayAfter(Restarts::soundRun).count(), 100);
}

}  // namespace
}  // namespace hearth
