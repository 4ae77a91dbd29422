// Subscriptions, alarms, and callbacks for named notifications.
#include <cmath>
#include <limits>

#include "pairwelld/TarnNotificationHelper.hpp"
#include "pairwelld/notifications/SystemNotificationManager.hpp"
#include "pairwelld/notifications/TarnNotificationManager.hpp"
#include "tests/pairwelld/World.hpp"

namespace pairwell {
namespace {

class NotificationsTest : public World {
 protected:
  ~NotificationsTest() override { unregisterAll(); }

  static std::shared_ptr<SystemNotificationManager> alarms() { return SystemNotificationManager::shared(); }
  auto subscribe(const char* label) { return alarms()->subscribe(makeSubscriber(label)); }
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

  std::shared_ptr<TarnNotificationHelper> helper(const std::string& label, const Calls& names) {
    std::map<std::string, TarnNotificationHelper::Callback> handlers;
    for (const auto& name : names) handlers[name] = [this, label, name] { calls.push_back(label + name); };
    auto made = TarnNotificationHelper::create(handlers);
    helpers.push_back(made);
    return made;
  }
  void unregisterAll() {
    for (const auto& weak : helpers) {
      if (const auto left = weak.lock()) TarnNotificationManager::shared()->unregisterHelper(*left);
    }
  }

  std::vector<std::weak_ptr<TarnNotificationHelper>> helpers;
};

TEST_F(NotificationsTest, SubscribersAreCalledInOrderUntilTheyHaveLeft) {
  const auto first = subscribe("a"), second = subscribe("b"), third = subscribe("c");
  const auto again = alarms()->subscribe(first.subscriber());
  EXPECT_FALSE(first == again);
  EXPECT_TRUE(second == Subscription(second));
  EXPECT_THAT(callsAfterAlarm(), ElementsAre("a alarm x", "b alarm x", "c alarm x", "a alarm x"));
  EXPECT_EQ(log().back(), "notification default: On conduit event stream, com.kestrel.alarm, notification x");

  std::vector<std::optional<std::error_code>> results;
  const auto completion = [&](const auto& error) { results.push_back(error); };
  second.unsubscribe(completion);
  second.unsubscribe(completion);
  EXPECT_THAT(results, IsEmpty());
  run();
  EXPECT_THAT(results, ElementsAre(std::nullopt, std::nullopt));
  EXPECT_THAT(callsAfterAlarm(), ElementsAre("a alarm x", "c alarm x", "a alarm x"));
  first.unsubscribe(completion);
  run();
  EXPECT_THAT(callsAfterAlarm(), ElementsAre("c alarm x", "a alarm x"));
}

TEST_F(NotificationsTest, AnEventUnderWayReachesThoseWhoLeaveMeanwhile) {
  const auto first = makeSubscriber("a");
  const auto handle = alarms()->subscribe(first), other = subscribe("b");
  first->onCall = [this, other] {
    other.unsubscribe([](const auto&) {});
    while (!platform.pool->isEmpty()) platform.pool->runOne();
  };
  EXPECT_THAT(callsAfterAlarm(), ElementsAre("a alarm x", "b alarm x"));
  EXPECT_THAT(callsAfterAlarm(), ElementsAre("a alarm x"));
}

TEST_F(NotificationsTest, EventsWithoutANameAreIgnored) {
  const auto handle = subscribe("a");
  TarnNotificationManager::shared()->setUp();
  for (const char* stream : {"com.kestrel.alarm", "com.kestrel.tidingsd.matching"}) {
    EXPECT_THAT(callsAfterEvent(stream, {{"name", "x"}}), IsEmpty());
    EXPECT_THAT(callsAfterEvent(stream, {{"Name", 7}}), IsEmpty());
  }
  EXPECT_THAT(log(), IsEmpty());
}

TEST_F(NotificationsTest, UnsubscribingCompletesWhateverTheBlockSaysAndWhoeverLives) {
  const auto subscriber = makeSubscriber("a");
  const auto fault = std::make_error_code(std::errc::io_error);
  std::vector<std::optional<std::error_code>> results;
  const auto completion = [&](const auto& error) { results.push_back(error); };
  Subscription<Subscriber>(subscriber, [&](const auto&) { return fault; }).unsubscribe(completion);
  auto publisher = SystemNotificationManager::create();
  const std::weak_ptr<SystemNotificationManager> weak = publisher;
  const auto handle = publisher->subscribe(subscriber);
  publisher.reset();
  EXPECT_FALSE(weak.expired());
  platform.streams.handlers.clear();
  EXPECT_TRUE(weak.expired());
  handle.unsubscribe(completion);
  run();
  EXPECT_THAT(results, ElementsAre(fault, std::nullopt));
}

TEST_F(NotificationsTest, AlarmsDropTheFractionAndRefuseWhatHasNoDate) {
  constexpr double infinity = std::numeric_limits<double>::infinity();
  constexpr std::int64_t rejected = 5;
  const struct {
    const char* name;
    double seconds;
    std::int64_t nanoseconds;
    const char* text;
  } table[] = {
      {"fraction", 12.9, 12'000'000'000, "12.900000"},
      {"negative rounds toward zero", -1.5, -1'000'000'000, "-1.500000"},
      {"last", 9223372036.75, 9'223'372'036'000'000'000, "9223372036.750000"},
      {"past the last", 9223372037, rejected, "9223372037.000000"},
      {"first", -9223372036.75, -9'223'372'036'000'000'000, "-9223372036.750000"},
      {"before the first", -9223372037, rejected, "-9223372037.000000"},
      {"not a number", std::nan(""), rejected, "nan"},
      {"infinite", infinity, rejected, "inf"},
      {"negative infinite", -infinity, rejected, "-inf"},
  };
  const auto& kept = platform.streams.alarms;
  for (const auto& row : table) {
    SCOPED_TRACE(row.name);
    platform.streams.setEvent("com.kestrel.alarm", "x", platform::Dictionary{{"Date", platform::Date{5}}});
    mark();
    alarms()->scheduleAlarm("x", row.seconds);
    Calls expected = {std::string("notification default: Scheduling alarm: x for ") + row.text};
    if (row.nanoseconds == rejected) {
      expected.push_back("notification error: Alarm rejected, its time is out of range: x for " +
                         std::string(row.text));
    } else {
      expected.push_back("alarm x at " + std::to_string(row.nanoseconds) + " ns");
    }
    EXPECT_EQ(effects(Effects::log | Effects::alarm), expected);
    ASSERT_EQ(kept.size(), 1u);
    EXPECT_EQ(kept.begin()->second.nanoseconds, row.nanoseconds);
  }
  alarms()->scheduleAlarm("x", platform::Time(7.5));
  EXPECT_EQ(kept.begin()->second.nanoseconds, 7'000'000'000);
  mark();
  alarms()->cancelAlarm("y");
  alarms()->cancelAlarm("x");
  EXPECT_THAT(effects(Effects::log | Effects::alarm),
              ElementsAre("notification default: Canceling alarm: y", "alarm y cleared",
                          "notification default: Canceling alarm: x", "alarm x cleared"));
  EXPECT_TRUE(kept.empty());
}

TEST_F(NotificationsTest, AHelperAnswersToItsNamesOnBothRoutes) {
  TarnNotificationManager::shared()->setUp();
  EXPECT_THAT(callsAfterMatch("a"), IsEmpty());
  const auto matching = [](std::string name) {
    return "daemon default: On conduit event stream, com.kestrel.tidingsd.matching, notification " + name;
  };
  const std::string invoking = "daemon default: Invoking callback, notification, ";
  EXPECT_THAT(log(), ElementsAre(matching("a")));
  mark();
  helper("1", {"b", "a"});
  EXPECT_THAT(log(), ElementsAre("daemon default: Setup tarn callback handlers",
                                 "daemon default: Setting up tarn callback handler for a",
                                 "daemon default: Setting up tarn callback handler for b"));
  helper("2", {"a"});
  helper("none", {});
  mark();
  EXPECT_THAT(callsAfterMatch("a"), ElementsAre("1a", "2a"));
  EXPECT_THAT(callsAfterMatch("A"), IsEmpty());
  EXPECT_THAT(log(), ElementsAre(matching("a"), invoking + "a", invoking + "a", matching("A")));
  mark();
  calls.clear();
  platform.named.postFromElsewhere("b");
  run();
  EXPECT_THAT(calls, ElementsAre("1b"));
  EXPECT_THAT(log(), ElementsAre("daemon default: Got tarn notification, b", invoking + "b"));
  mark();
  for (bool* loses : {&platform.namedCentre.losesName, &platform.namedCentre.losesObserver}) {
    *loses = true;
    platform.named.postFromElsewhere("b");
    run();
  }
  EXPECT_THAT(log(), ElementsAre("daemon error: loomNotificationName for tarn callback handler not found",
                                 "daemon error: Observer for tarn callback handler not found"));
  EXPECT_THAT(calls, ElementsAre("1b"));
}

TEST_F(NotificationsTest, AHelperLivesAsLongAsItsRegistration) {
  TarnNotificationManager::shared()->setUp();
  auto twice = helper("1", {"b", "a"});
  TarnNotificationManager::shared()->registerHelper(twice);
  const std::weak_ptr<TarnNotificationHelper> weak = twice;
  twice.reset();
  helper("2", {"a"});
  EXPECT_THAT(callsAfterMatch("a"), ElementsAre("1a", "1a", "2a"));
  platform.named.postFromElsewhere("b");  // on its way when the helper goes
  mark();
  TarnNotificationManager::shared()->unregisterHelper(*weak.lock());
  EXPECT_TRUE(weak.expired());
  EXPECT_THAT(log(), ElementsAre("daemon default: Remove tarn callback handler for a",
                                 "daemon default: Remove tarn callback handler for b"));
  EXPECT_EQ(platform.namedCentre.observers.size(), 1u);
  EXPECT_THAT(callsAfterMatch("a"), ElementsAre("2a"));
  mark();
  platform.hasNamedCentre = false;
  EXPECT_THROW(helper("3", {"a"}), fakes::Stopped);
  unregisterAll();
  EXPECT_THAT(log(), IsEmpty());
}

TEST_F(NotificationsTest, AHelperMayLeaveInItsOwnCallback) {
  TarnNotificationManager::shared()->setUp();
  auto leaver = helper("", {});
  leaver->notificationHandlers["a"] = [this, held = std::string("leaver")] {
    helpers.front().lock()->notificationHandlers.clear();
    TarnNotificationManager::shared()->unregisterHelper(*helpers.front().lock());
    calls.push_back(held);
  };
  leaver.reset();
  const auto other = helper("2", {"a"});
  EXPECT_THAT(callsAfterMatch("a"), ElementsAre("leaver", "2a"));
  EXPECT_TRUE(helpers.front().expired());
}

}  // namespace
}  // namespace pairwell
