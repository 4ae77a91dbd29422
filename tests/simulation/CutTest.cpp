// One device's daemon on files that survive it: cut short between any two effects of a switch, and started
// with an alarm that is overdue.
#include "tests/simulation/Device.hpp"

namespace simulation {
namespace {

// One run of the daemon's process.
struct Life : Pairwelld {
  Life(Machine& machine_, Time& now_) : Pairwelld(machine_, now_, 1), machine(machine_), now(now_) {
    settle();
  }
  void settle() {
    runAll();
    machine.files.deliverEvents();
    runAll();
  }
  void switchTo(bool enabled) {
    say(enabled);
    settle();
  }
  void pass(Time duration) {
    now += duration;
    manualClock.time = now;
    eventStreams().deliverDue();
    while (!loop.queue->isEmpty()) loop.queue->runOne();  // an event comes before a client's call
    settle();
  }
  bool flag() { return flagIn(*machine.entries()); }
  double end() { return endIn(*machine.entries()); }
  bool isClean() { return !isOn() && !rootFlag() && !flag() && end() == 0 && machine.alarms.list().empty(); }
  // On, and everything says so.
  bool isWholly() {
    const auto alarms = machine.alarms.list();
    return isOn() && rootFlag() && flag() && end() > 0 && alarms.size() == 1 &&
           alarms[0].date == platform::Date::ofSeconds(end());
  }

  Machine& machine;
  Time& now;
};

struct CutTest : testing::Test {
  void TestBody() override {}
  // The switch to `enabled` from its opposite, with the Nth operation and all after it failing; whether it
  // was cut.
  bool cutSwitch(bool enabled, int operation) {
    Life life(machine, now);
    if (!enabled) life.switchTo(true);
    machine.files.failFrom = machine.files.calls + operation;
    life.switchTo(enabled);
    return machine.files.calls >= std::exchange(machine.files.failFrom, std::numeric_limits<int>::max());
  }
  void checkAfterwards() {
    {
      Life life(machine, now);
      EXPECT_EQ(life.isOn(), life.flag());
      // Off may leave the root flag, an end time or an alarm behind; on is whole.
      EXPECT_EQ(life.isOn(), life.isWholly());
      life.pass(Time(345'602));
      EXPECT_FALSE(life.isOn() || life.flag());
      EXPECT_TRUE(machine.alarms.list().empty());
    }
    Life life(machine, now);
    const bool endLeft = life.end() > 0;
    life.switchTo(true);
    if (endLeft) {
      EXPECT_TRUE(life.isClean()) << "an end that has passed is cleared first";
      life.switchTo(true);
    }
    EXPECT_TRUE(life.isWholly());
    life.switchTo(false);
    EXPECT_TRUE(life.isClean());
  }

  Machine machine;
  Time now{1'000'000};
};

TEST_F(CutTest, LeavesOnlyKnownResiduesAndADeviceThatWorks) {
  for (const bool enabled : {true, false}) {
    for (const bool power : {false, true}) {
      int cuts = 0;
      for (bool cut = true; cut && !HasFailure(); cuts += cut) {
        SCOPED_TRACE(testing::Message() << (enabled ? "on" : "off") << (power ? ", power cut" : "")
                                        << " at operation " << cuts + 1);
        CutTest each;
        cut = each.cutSwitch(enabled, cuts + 1);
        if (power) each.machine.files.powerCut();
        each.checkAfterwards();
      }
      EXPECT_GT(cuts, 30) << "operations of a switch";
    }
  }
}

TEST_F(CutTest, AnOverdueAlarmDoesNotEndWhatIsSwitchedOnWhileItWaits) {
  machine.alarms.set({"pairwelld", std::string(platform::EventStreams::alarms), flagKey},
                     *platform::Date::ofSeconds(999'000));
  Life life(machine, now);
  life.switchTo(true);
  for (int step = 0; step < 20; ++step) {
    life.pass(Time(0.25));
    EXPECT_TRUE(life.isWholly());
  }
  EXPECT_EQ(life.end(), 1'000'000 + 345'600);
}

}  // namespace
}  // namespace simulation
