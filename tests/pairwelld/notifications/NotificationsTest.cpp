// Subscriptions, alarms, and callbacks for named notifications.
#include <limits>

#include "pairwelld/TarnNotificationHelper.hpp"
#include "pairwelld/notifications/SystemNotificationManager.hpp"
#include "pairwelld/notifications/TarnNotificationManager.hpp"
#include "tests/pairwelld/World.hpp"

namespace pairwell {
namespace {

struct NotificationsTest : World {
  ~NotificationsTest() override {
    for (const auto& weak : helpers) {
      if (const auto left = weak.lock()) TarnNotificationManager::shared()->unregisterHelper(*left);
    }
  }
  static std::shared_ptr<SystemNotificationManager> alarms() { return SystemNotificationManager::shared(); }
  Calls callsAfterEvent(const std::string& stream, const platform::Dictionary& event) {
    calls.clear();
    platform.streams.deliver(stream, event);
    run();
    return calls;
  }
  Calls callsAfterAlarm() { return callsAfterEvent("com.kestrel.alarm", {{"Name", "x"}}); }
  Calls callsAfterMatch(const char* name) {
    return callsAfterEvent("com.kestrel.tidingsd.matching", {{"Name", name}});
  }
  // Registered: it lives until it is unregistered.
  void helper(const std::string& label, const Calls& names) {
    std::map<std::string, TarnNotificationHelper::Callback> handlers;
    for (const auto& name : names) handlers[name] = [this, label, name] { calls.push_back(label + name); };
    helpers.push_back(TarnNotificationHelper::create(handlers));
  }

  std::vector<std::weak_ptr<TarnNotificationHelper>> helpers;
};

TEST_F(NotificationsTest, SubscribersAreCalledInOrderUntilTheyHaveLeft) {
  const auto a = makeSubscriber("a"), b = makeSubscriber("b"), c = makeSubscriber("c");
  const auto first = alarms()->subscribe(a), second = alarms()->subscribe(b), third = alarms()->subscribe(c);
  const auto again = alarms()->subscribe(a);
  std::vector<std::optional<std::error_code>> results;
  a->onCall = [&] {
    a->onCall = nullptr;
    for (int time = 0; time < 2; ++time)
      second.unsubscribe([&](const auto& error) { results.push_back(error); });
    EXPECT_THAT(results, IsEmpty());
    while (!platform.pool->isEmpty()) platform.pool->runOne();
  };
  EXPECT_THAT(callsAfterAlarm(), ElementsAre("a alarm x", "b alarm x", "c alarm x", "a alarm x"));
  EXPECT_EQ(log().back(), "notification default: On conduit event stream, com.kestrel.alarm, notification x");
  EXPECT_THAT(results, ElementsAre(std::nullopt, std::nullopt));
  first.unsubscribe([](const auto&) {});
  run();
  EXPECT_THAT(callsAfterAlarm(), ElementsAre("c alarm x", "a alarm x"));
  mark();
  EXPECT_THAT(callsAfterEvent("com.kestrel.alarm", {{"name", "x"}}), IsEmpty());
  EXPECT_THAT(callsAfterEvent("com.kestrel.alarm", {{"Name", 7}}), IsEmpty());
  EXPECT_THAT(log(), IsEmpty());
}

TEST_F(NotificationsTest, AlarmsDropTheFractionAndRefuseWhatHasNoDate) {
  const std::pair<double, std::int64_t> rows[] = {{-1.5, -1'000'000'000},
                                                  {9223372036.75, 9'223'372'036'000'000'000},
                                                  {-9223372036.75, -9'223'372'036'000'000'000}};
  const auto& kept = platform.streams.alarms;
  for (const auto& [seconds, nanoseconds] : rows) {
    alarms()->scheduleAlarm("x", seconds);
    EXPECT_EQ(log().back(), "notification default: Scheduling alarm: x for " + std::to_string(seconds));
    ASSERT_EQ(kept.size(), 1u);
    EXPECT_EQ(kept.begin()->second.nanoseconds, nanoseconds);
  }
  for (const double seconds : {9223372037.0, -9223372037.0, std::numeric_limits<double>::quiet_NaN()}) {
    alarms()->scheduleAlarm("x", seconds);
    EXPECT_EQ(log().back(), "notification error: Alarm rejected, its time is out of range: x for " +
                                std::to_string(seconds));
    EXPECT_EQ(kept.begin()->second.nanoseconds, rows[2].second) << "the one before stays";
  }
  mark();
  alarms()->cancelAlarm("x");
  EXPECT_THAT(effects(Effects::log | Effects::alarm),
              ElementsAre("notification default: Canceling alarm: x", "alarm x cleared"));
}

TEST_F(NotificationsTest, AHelperAnswersToItsNamesOnBothRoutesWhileRegistered) {
  const std::string channel = "daemon default: ", invoking = channel + "Invoking callback, notification, ",
                    matching =
                        channel + "On conduit event stream, com.kestrel.tidingsd.matching, notification ";
  TarnNotificationManager::shared()->setUp();
  helper("1", {"b", "a"});
  EXPECT_THAT(log(), ElementsAre(channel + "Setup tarn callback handlers",
                                 channel + "Setting up tarn callback handler for a",
                                 channel + "Setting up tarn callback handler for b"));
  helper("2", {"a"});
  mark();
  EXPECT_THAT(callsAfterMatch("a"), ElementsAre("1a", "2a"));
  EXPECT_THAT(callsAfterMatch("A"), IsEmpty());
  EXPECT_THAT(callsAfterEvent("com.kestrel.tidingsd.matching", {{"Name", 7}}), IsEmpty());
  platform.named.postFromElsewhere("b");
  run();
  EXPECT_THAT(calls, ElementsAre("1b"));
  EXPECT_THAT(log(), ElementsAre(matching + "a", invoking + "a", invoking + "a", matching + "A",
                                 channel + "Got tarn notification, b", invoking + "b"));
  mark();
  TarnNotificationManager::shared()->unregisterHelper(*helpers[0].lock());
  EXPECT_TRUE(helpers[0].expired());
  EXPECT_THAT(log(), ElementsAre(channel + "Remove tarn callback handler for a",
                                 channel + "Remove tarn callback handler for b"));
  EXPECT_EQ(platform.named.registrations.size(), 1u);
}

}  // namespace
}  // namespace pairwell
