#include "tests/simulation/Account.hpp"

#include <algorithm>
#include <utility>

namespace simulation {

using platform::linux_::FileUserPreferences;
using platform::linux_::ReplicaFileCloudStore;

Account::Account(std::uint64_t seed, int devices, Counts& counts_) : counts(counts_), random(seed) {
  network.random.seed(seed);
  network.now = Time(1e9);
  for (int index = 0; index < devices; ++index) {
    auto node = std::make_unique<Node>();
    node->name = "device-" + std::to_string(index);
    const bool isYearsOff = index > 0 && index == devices - 1 && draw(0.2);
    node->machine.offset = Time(isYearsOff ? draw(-7e7, 7e7) : draw(0.8) ? draw(-0.01, 0.01) : draw(-3, 3));
    node->machine.files.put(replicaPath, *platform::linux_::encodeSettings({{"device", node->name}}));
    node->machine.files.onLock = [this, &each = *node] { workTakesTime(each); };
    node->kept = node->machine.entries();
    nodes.push_back(std::move(node));
  }
  // What is written before an account is joined gives way to it, which is no fault here.
  network.isCalm = true;
  for (auto& node : nodes) boot(*node);
  advance(10);
  network.isCalm = false;
}

void Account::perform(const Event& event) {
  ++counts.events;
  random.seed(event.draw);
  network.random.seed(event.draw + 1);
  apply(event, at(event.device));
  for (int steps = draw(40); steps > 0 && step(); --steps) {
  }
  if (draw(0.5)) settle();
  if (draw(0.5)) advance(draw(0, draw(0.8) ? 0.1 : 100.0));
}

void Account::apply(const Event& event, Node& node) {
  switch (event.kind) {
    case Event::on:
    case Event::off:
      return say(node, event.kind == Event::on);
    case Event::override_:
      setOverride(node);
      return say(node, true);
    case Event::rivals:
      for (Node* each : {&node, &at(draw(static_cast<int>(nodes.size())))}) {
        setOverride(*each);
        say(*each, true);
      }
      return;
    case Event::foreign:
      return writeForeign(node);
    case Event::question:
      return ask(node);
    case Event::killDaemon:
    case Event::killSync:
    case Event::killBoth:
    case Event::powerCut:
      return crash(event.kind, node);
    case Event::shutDown:
      node.daemon.reset();
      node.sync.reset();
      return;
    case Event::start:
      return boot(node);
    case Event::partition:
    case Event::heal:
      return cut(node, event.kind == Event::partition);
    case Event::loss:
      return network.lose(node.name);
    case Event::wait:
      return advance(draw(0, draw(0.5) ? 30.0 : 400'000.0));
    case Event::leap:
      node.machine.offset = draw(0.7) ? Time(draw(-0.01, 0.01)) : node.machine.offset + Time(draw(-20, 20));
      return;
  }
}

void Account::boot(Node& node) {
  if (!node.daemon) {
    node.daemon = std::make_unique<Pairwelld>(node.machine, network.now, random());
    node.calls.clear();
    node.question.reset();
    node.lastCall.reset();
    node.wasOn = node.hasStopped = false;
  }
  if (node.sync) return;
  const std::string writer = node.name + "/" + std::to_string(++writers);
  node.sync = std::make_unique<Cloudsyncd>(node.machine, network, writer);
}

void Account::say(Node& node, bool on) {
  boot(node);
  const auto entries = node.machine.entries();
  const bool isSettled = node.daemon->state() == flagIn(*entries);
  const bool endIsLeft = endIn(*entries) > 0 && !(isSettled && node.daemon->state());
  node.lastCall = isSettled && !endIsLeft ? std::optional(on) : std::nullopt;
  node.calls.insert(on);
  node.daemon->say(on);
}

// Its ends are near, and so differ between devices.
void Account::setOverride(Node& node) {
  const auto user = FileUserPreferences::create(node.machine.files, nullptr, "/var/user.json");
  user->setValue(Value(draw(0.5, draw(0.5) ? 20.0 : 5000.0)), pairwell::overrideKey);
}

void Account::writeForeign(Node& node) {
  fakes::ManualClock clock;
  clock.time = network.now + node.machine.offset;
  platform::NotificationCentre centre;
  ReplicaFileCloudStore::create(node.machine.files, nullptr, centre, clock, replicaPath)
      ->setValue(Value(draw(1000)), "foreign-" + std::to_string(draw(3)));
  noteKept(node);
}

void Account::ask(Node& node) {
  if (!node.daemon) return;
  bool isOn = false;
  runDaemon(node, [&] { isOn = node.daemon->isOn(); });
  const auto entries = node.machine.entries();
  const double end = endIn(*entries);
  const bool hasPassed = end > 0 && end < node.daemon->manualClock.time.count();
  check(!isOn || !hasPassed, node.name + " answers \"on\" after its end");
  if (hasPassed && flagIn(*entries)) node.question = end;
}

// In the midst of what is under way, or of one operation. The rest of it fails, as nobody is there to do it.
void Account::crash(Event::Kind kind, Node& node) {
  ++counts.crashes;
  for (int steps = draw(30); steps > 0 && step(); --steps) {
  }
  if (node.daemon && draw(0.5)) say(node, draw(0.5));
  auto& files = node.machine.files;
  files.failFrom = files.calls + 1 + draw(60);
  for (int items = draw(12); items > 0; --items) {
    if (node.daemon && kind != Event::killSync && !node.daemon->isIdle())
      runDaemon(node, [&] { node.daemon->runOne(); });
    if (node.sync && kind != Event::killDaemon) runSync(node, [&] { node.sync->work(); });
  }
  if (kind != Event::killSync) node.daemon.reset();
  if (kind != Event::killDaemon) node.sync.reset();
  if (files.calls >= files.failFrom) node.unsure = node.machine.entries();
  files.failFrom = std::numeric_limits<int>::max();
  if (kind == Event::powerCut) {
    ++counts.powerCuts;
    files.powerCut();
    noteKept(node);
  }
  if (draw(0.5)) boot(node);
}

void Account::cut(Node& node, bool isCut) {
  counts.partitions += isCut && !node.machine.isCut;
  node.machine.isCut = isCut;
  if (node.sync) node.sync->link.reconnect();
}

void Account::tick(Node& node) {
  const Time now = network.now + node.machine.offset;
  if (node.daemon) node.daemon->manualClock.time = now;
  if (node.sync) node.sync->platform->manualClock.time = now;
}

// One item of work of one device, a file event or a message that is due. False: nothing is left to do now.
bool Account::step() {
  std::vector<std::function<void()>> ready;
  for (auto& each : nodes) {
    Node& node = *each;
    const bool isFree = node.daemon && running != &node;
    if (isFree && !node.daemon->isIdle()) {
      ready.push_back([&] { runDaemon(node, [&] { node.daemon->runOne(); }); });
    } else if (isFree) {
      becomeIdle(node);
    }
    if (node.sync && !node.sync->platform->isIdle())
      ready.push_back([&] { runSync(node, [&] { node.sync->platform->runOne(); }); });
    if (node.machine.files.hasEvents()) ready.push_back([&] { node.machine.files.deliverEvents(); });
  }
  if (network.nextDue() && *network.nextDue() <= network.now) ready.push_back([this] { deliverMessage(); });
  if (ready.empty()) return false;
  ready[static_cast<std::size_t>(draw(static_cast<int>(ready.size())))]();
  network.now += Time(draw(0, 0.001));
  return true;
}

void Account::becomeIdle(Node& node) {
  const bool isOn = flagIn(*node.machine.entries());
  check(!node.lastCall || isOn == *node.lastCall || (*node.lastCall && node.hasStopped),
        node.name + " has lost a client's last word");
  node.lastCall.reset();
  node.calls.clear();
  node.question.reset();
  node.daemon->eventStreams().delivered.reset();
}

void Account::runDaemon(Node& node, const std::function<void()>& work) {
  tick(node);
  node.before = node.machine.entries();
  node.from = node.daemon->manualClock.time.count();
  node.hasBegun = node.hasMerged = false;
  Node* const former = std::exchange(running, &node);
  work();
  running = former;
  noteWork(node);
  const bool isOn = node.daemon->state();
  node.hasStopped = !isOn && (node.hasStopped || node.wasOn);
  node.wasOn = isOn;
}

void Account::noteWork(Node& node) {
  const auto before = std::exchange(node.before, node.machine.entries());
  if (node.before == before) return;
  const auto& files = node.machine.files;
  const auto alarm = node.daemon->eventStreams().delivered;
  witness.wrote({node.name, *before, *node.before, node.from, node.daemon->manualClock.time.count(),
                 files.calls >= files.failFrom, node.hasBegun, node.hasMerged, node.calls,
                 alarm ? std::optional(static_cast<double>(alarm->nanoseconds) / 1e9) : std::nullopt,
                 node.question});
  noteKept(node);
}

void Account::runSync(Node& node, const std::function<void()>& work) {
  tick(node);
  const auto before = node.machine.entries();
  const platform::PlatformScope scope(*node.sync->platform);
  work();
  noteKept(node);
  noteMerge(node, *before);
}

// What has been acknowledged is there, or what outranks it; and what is there now has been acknowledged,
// unless the process died before it could say so.
void Account::noteKept(Node& node) {
  const auto entries = node.machine.entries();
  if (entries == node.kept || entries == node.unsure) return;
  for (const auto& [key, value] : *node.kept) {
    const auto was = CloudEntry::fromValue(value), is = CloudEntry::find(*entries, key);
    check(is && !was->outranks(*is), node.name + " has lost a write of " + key);
  }
  witness.checkPair(node.name, *node.kept, *entries);
  const auto& files = node.machine.files;
  if (files.calls < files.failFrom) node.kept = entries;
}

// Between what a daemon's write was decided on and the write: a disk is slow, and others go on meanwhile.
void Account::workTakesTime(Node& node) {
  ++locks;
  if (running != &node || isPaused) return;
  isPaused = true;
  network.now += Time(draw(0, 0.004));
  if (draw(0.05)) {
    const auto before = node.before;
    noteWork(node);
    node.hasBegun |= platform::valueOf(*before, flagKey) != platform::valueOf(*node.before, flagKey);
    othersWork();
  }
  tick(node);
  isPaused = false;
}

// They see what has been written of a switch so far.
void Account::othersWork() {
  const platform::PlatformScope scope(outside);
  const Time end = network.now + Time(draw(0, 0.3));
  while (network.now < end) {
    if (step()) continue;
    const auto due = nextDue();
    if (!due || *due > end) break;
    network.now = std::max(network.now, *due);
    fireDue();
  }
  network.now = std::max(network.now, end);
}

void Account::deliverMessage() {
  std::vector<std::shared_ptr<const Dictionary>> before;
  for (auto& node : nodes) {
    tick(*node);
    before.push_back(node->machine.entries());
  }
  network.deliverNext();
  for (std::size_t index = 0; index < nodes.size(); ++index) {
    noteKept(*nodes[index]);
    noteMerge(*nodes[index], *before[index]);
  }
}

void Account::noteMerge(Node& node, const Dictionary& before) {
  for (const std::string& key : {flagKey, endKey}) {
    if (platform::valueOf(before, key) == platform::valueOf(*node.machine.entries(), key)) continue;
    node.hasMerged = true;
    node.lastCall.reset();
  }
}

void Account::settle() {
  int count = 0;
  while (step()) check(++count < 50'000, "the devices do not come to rest");
}

// Lets time pass, from one thing that is due to the next.
void Account::advance(double seconds) {
  const Time target = network.now + Time(seconds);
  for (int count = 0;; ++count) {
    check(count < 50'000, "something is scheduled for ever");
    settle();
    const auto due = nextDue();
    if (!due || *due > target) break;
    network.now = std::max(network.now, *due);
    fireDue();
  }
  network.now = std::max(network.now, target);
  settle();
}

std::optional<Time> Account::nextDue() {
  std::optional<Time> next = network.nextDue();
  const auto consider = [&](const std::optional<Time>& due) {
    if (due && (!next || *due < *next)) next = due;
  };
  for (auto& node : nodes) {
    tick(*node);
    if (node->daemon) consider(node->daemon->eventStreams().nextDue());
    if (node->sync) consider(node->sync->nextDue());
  }
  return next;
}

void Account::fireDue() {
  for (auto& node : nodes) {
    tick(*node);
    if (node->daemon) node->daemon->eventStreams().deliverDue();
    if (node->sync) runSync(*node, [&] { node->sync->synchroniser.timePassed(); });
  }
}

}  // namespace simulation
