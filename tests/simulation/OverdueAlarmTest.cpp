// An alarm that is overdue when its job starts, and a switch within the second that it waits.
#include "tests/simulation/Device.hpp"

namespace simulation {
namespace {

TEST(OverdueAlarmTest, DoesNotEndWhatIsSwitchedOnWhileItWaits) {
  Machine machine;
  machine.alarms.set({"pairwelld", std::string(platform::EventStreams::alarms), flagKey},
                     *platform::Date::ofSeconds(999'000));
  Time now{1'000'000};
  Pairwelld daemon(machine, now, 1);
  daemon.runAll();
  daemon.say(true);
  for (const Time end = now + Time(5); now < end; now += Time(0.25)) {
    daemon.manualClock.time = now;
    daemon.eventStreams().deliverDue();
    while (!daemon.loop.queue->isEmpty()) daemon.loop.queue->runOne();  // the event comes before the switch
    daemon.runAll();
    EXPECT_TRUE(daemon.isOn());
  }
  ASSERT_EQ(machine.alarms.list().size(), 1u);
  EXPECT_EQ(machine.alarms.list()[0].date, platform::Date::ofSeconds(1'000'000 + 345'600));
}

}  // namespace
}  // namespace simulation
