// What holds when nothing is left to do.
#include <algorithm>

#include "tests/simulation/Account.hpp"

namespace simulation {

void Account::finish() {
  random.seed(0);
  network.isCalm = true;
  for (auto& node : nodes) {
    boot(*node);
    if (node->machine.isCut) cut(*node, false);  // nobody else connects anew
  }
  rest();
  for (auto& node : nodes) ask(*node);  // an end that has passed without an alarm is noticed
  rest();
  checkRest();
  compareAll();
  passEnd();
}

// Until nothing but alarms is left.
void Account::rest() {
  const Time limit = network.now + Time(600);
  for (;;) {
    settle();
    const bool isQuiet = network.isQuiet() && std::none_of(nodes.begin(), nodes.end(), [](const auto& node) {
                           return node->sync->nextDue().has_value();
                         });
    if (isQuiet) return;
    check(network.now < limit, "the account does not come to rest");
    advance(1);
  }
}

void Account::checkRest() {
  const long sent = network.sent, locked = locks;
  const auto alarm = nextDue();
  advance(alarm ? std::clamp((*alarm - network.now).count() - 0.01, 0.0, 3600.0) : 3600.0);
  check(network.sent == sent, "something is published at rest");
  check(locks == locked, "something is written at rest");
}

void Account::compareAll() {
  const Dictionary& shared = *nodes[0]->machine.entries();
  for (auto& node : nodes) {
    const Dictionary& own = *node->machine.entries();
    check(own == shared, node->name + " differs from " + nodes[0]->name + ": " + platform::describe(own) +
                             " and " + platform::describe(shared));
    check(node->daemon->state() == flagIn(shared), node->name + " is not as the shared flag");
    compareAlarms(*node, flagIn(shared), endIn(shared));
  }
  witness.checkShared(shared);
}

void Account::compareAlarms(Node& node, bool on, double end) {
  const auto alarms = node.machine.alarms.list();
  if (!on) {
    check(!node.hasStopped || (alarms.empty() && !node.daemon->rootFlag()),
          node.name + " keeps something of a period that it stopped");
    counts.leftAlarms += !alarms.empty();
    counts.leftRootFlags += node.daemon->rootFlag();
    return;
  }
  check(alarms.size() == 1, node.name + " has " + std::to_string(alarms.size()) + " alarms for one period");
  check(node.daemon->rootFlag(), node.name + " is on without its root flag");
  counts.staleAlarms += alarms[0].date != platform::Date::ofSeconds(end);
}

// By everybody's clock.
void Account::passEnd() {
  const double end = endIn(*nodes[0]->machine.entries());
  if (!flagIn(*nodes[0]->machine.entries()) || !(end > 0)) return;
  for (auto& node : nodes) {
    const double left = end + 2 - (network.now + node->machine.offset).count();
    if (left > 0) advance(left);
  }
  for (auto& node : nodes) ask(*node);
  rest();
  for (auto& node : nodes)
    check(!node->daemon->state() && !flagIn(*node->machine.entries()), node->name + " is on after the end");
}

}  // namespace simulation
