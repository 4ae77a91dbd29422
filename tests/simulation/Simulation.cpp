#include "tests/simulation/Simulation.hpp"

#include <algorithm>

namespace simulation {
namespace {

struct Failure {
  std::string text;
};
void check(bool holds, const std::string& text) {
  if (!holds) throw Failure{text};
}

// One device with its processes, and what is known of its last switch.
struct Node {
  Machine machine;
  std::string name;
  std::unique_ptr<Pairwelld> daemon;
  std::unique_ptr<Cloudsyncd> sync;
  // Since it was last idle: a client's last call, unless the state may be another's by then; and a merge.
  bool clientCalled = false;
  std::optional<bool> expected;
  bool merged = false;
  bool isBeginning = false;  // the flag is on, its end time is yet to be written
  bool stoppedInThisLife = false;
  std::string unsure;  // contents that a crash left, and that nobody was told are durable
};

class Run {
 public:
  Run(std::uint64_t seed, int devices, Counts& counts_) : counts(counts_), random(seed) {
    network.random.seed(seed);
    network.now = Time(10'000'000);
    for (int index = 0; index < devices; ++index) {
      auto node = std::make_unique<Node>();
      node->name = "device-" + std::to_string(index);
      node->machine.offset = index == 0 && chance(random, 0.2)
                                 ? Time(chance(random, 0.5) ? 7e7 : -7e6)
                                 : Time(std::uniform_real_distribution<>(-3, 3)(random));
      node->machine.files.put(replicaPath, *platform::linux_::encodeSettings({{"device", node->name}}));
      node->machine.files.onLock = [this, &each = *node] { mergeWithin(each); };
      nodes.push_back(std::move(node));
    }
    // What is written before an account is joined gives way to it, which is no fault here.
    network.isCalm = true;
    for (auto& node : nodes) boot(*node);
    advance(Time(10));
    network.isCalm = false;
  }

  void perform(const Event& event) {
    Random draw(event.draw);
    Node& node = *nodes[static_cast<std::size_t>(event.device)];
    apply(event, node, draw);
    for (int steps = below(draw, 40); steps > 0 && step(); --steps) {
    }
    if (chance(draw, 0.6)) settle();
    if (chance(draw, 0.5))
      advance(Time(std::uniform_real_distribution<>(0, chance(draw, 0.8) ? 0.1 : 100)(draw)));
  }

  void finish() {
    network.isCalm = true;
    for (auto& node : nodes) {
      node->machine.isCut = false;
      node->machine.files.failFrom = std::numeric_limits<int>::max();
      boot(*node);
      node->sync->link.reconnect();
    }
    rest();
    for (auto& node : nodes) node->daemon->isOn();  // an end that has passed is noticed
    rest();
    const long sent = network.sent;
    std::vector<std::string> files;
    for (auto& node : nodes) files.push_back(node->machine.files.bytes(replicaPath));
    // Up to the next alarm, which is not of this moment.
    const auto alarm = nextDue();
    advance(alarm ? std::clamp(*alarm - network.now - Time(0.01), Time(0), Time(30)) : Time(30));
    check(network.sent == sent, "something is published at rest");
    for (std::size_t index = 0; index < nodes.size(); ++index)
      check(nodes[index]->machine.files.bytes(replicaPath) == files[index], "something is written at rest");
    compareAll();
  }

 private:
  void boot(Node& node) {
    if (!node.daemon) {
      const double before = endOf(node.machine.entries());
      const bool wasOn = flagOf(node.machine.entries());
      node.daemon = std::make_unique<Pairwelld>(node.machine, network.now, random());
      node.stoppedInThisLife = node.isBeginning = false;
      node.clientCalled = node.merged = false;
      while (!node.daemon->isIdle()) runOne(node, *node.daemon);
      const double now = (network.now + node.machine.offset).count();
      if (wasOn && before > now + 1 && !node.merged)
        check(endOf(node.machine.entries()) == before, "a restart moves the end time");
    }
    if (!node.sync)
      node.sync =
          std::make_unique<Cloudsyncd>(node.machine, network, node.name + "/" + std::to_string(++writers));
  }

  void apply(const Event& event, Node& node, Random& draw) {
    ++counts.events;
    auto& files = node.machine.files;
    switch (event.kind) {
      case Event::on:
      case Event::off:
        return call(node, event.kind == Event::on);
      case Event::override_: {
        boot(node);
        const auto user = platform::linux_::FileUserPreferences::create(files, nullptr, "/var/user.json");
        user->setValue(Value(std::uniform_real_distribution<>(0.5, chance(draw, 0.5) ? 20 : 5000)(draw)),
                       pairwell::overrideKey);
        return call(node, true);
      }
      case Event::foreign: {
        fakes::ManualClock clock;
        clock.time = network.now + node.machine.offset;
        platform::NotificationCentre centre;
        const auto store =
            platform::linux_::ReplicaFileCloudStore::create(files, nullptr, centre, clock, replicaPath);
        return store->setValue(Value(below(draw, 1000)), "foreign-" + std::to_string(below(draw, 3)));
      }
      case Event::look:
        if (node.daemon) answer(node);
        return;
      case Event::killDaemon:
      case Event::killSync:
      case Event::killBoth:
      case Event::cutPower:
        return crash(event.kind, node, draw);
      case Event::away:
        shutDown(node);
        return;
      case Event::partition:
      case Event::heal:
        counts.partitions += event.kind == Event::partition && !node.machine.isCut;
        node.machine.isCut = event.kind == Event::partition;
        if (node.sync) node.sync->link.reconnect();
        return;
      case Event::wait:
        return advance(Time(std::uniform_real_distribution<>(0, chance(draw, 0.5) ? 30 : 400'000)(draw)));
      case Event::leap:
        node.machine.offset += Time(std::uniform_real_distribution<>(-20, 20)(draw));
        return;
    }
  }

  void call(Node& node, bool enabled) {
    boot(node);
    tick(node);
    node.clientCalled = true;
    // An end time that was left is taken up or, if it has passed, cleared first.
    const bool endIsLeft = !flagOf(node.machine.entries()) && endOf(node.machine.entries()) > 0;
    node.expected = endIsLeft ? std::nullopt : std::optional(enabled);
    node.daemon->say(enabled);
  }

  // In the middle of what is under way, or of one operation.
  void crash(Event::Kind kind, Node& node, Random& draw) {
    ++counts.crashes;
    auto& files = node.machine.files;
    node.expected.reset();  // a write that fails is not kept
    node.isBeginning = false;
    files.failFrom = files.calls + 1 + below(draw, 60);
    for (int steps = below(draw, 30); steps > 0 && step(); --steps) {
    }
    cutSwitch = cutSwitch || node.clientCalled || node.isBeginning;
    if (kind != Event::killSync) node.daemon.reset();
    if (kind != Event::killDaemon) node.sync.reset();
    const bool stays = chance(draw, 0.5);  // down, until it is needed
    files.failFrom = std::numeric_limits<int>::max();
    if (node.machine.bytes() != files.durableBytes(replicaPath)) node.unsure = node.machine.bytes();
    if (kind == Event::cutPower) {
      ++counts.powerCuts;
      files.powerCut();
    } else if (!stays) {
      boot(node);
    }
  }

  void shutDown(Node& node) {
    node.daemon.reset();
    node.sync.reset();
  }

  void tick(Node& node) {
    const Time now = network.now + node.machine.offset;
    if (node.daemon) node.daemon->manualClock.time = now;
    if (node.sync) node.sync->platform->manualClock.time = now;
  }

  void answer(Node& node) {
    tick(node);
    const double end = endOf(node.machine.entries());
    if (!node.daemon->isOn()) return;
    check(!(end > 0) || end >= (network.now + node.machine.offset).count(),
          "a device answers \"on\" after its end");
  }

  void runOne(Node& node, Process& process) {
    tick(node);
    const platform::PlatformScope scope(process);
    isRunning = &process == node.daemon.get();
    watching(node, isRunning, [&] { process.runOne(); });
    isRunning = false;
  }

  // One item of work of one device, a file event or a message that is due. False: nothing is left to do now.
  bool step() {
    std::vector<std::function<void()>> ready;
    for (auto& each : nodes) {
      Node* node = each.get();
      if (node->daemon && !node->daemon->isIdle())
        ready.push_back([this, node] { runOne(*node, *node->daemon); });
      if (node->sync && !node->sync->platform->isIdle())
        ready.push_back([this, node] { runOne(*node, *node->sync->platform); });
      if (node->machine.files.hasEvents()) ready.push_back([this, node] { deliverFileEvents(*node); });
    }
    if (network.nextDue() && *network.nextDue() <= network.now) ready.push_back([this] { deliverMessage(); });
    if (ready.empty()) {
      for (auto& node : nodes) becomeIdle(*node);
      return false;
    }
    ready[static_cast<std::size_t>(below(random, static_cast<int>(ready.size())))]();
    network.now += Time(
        std::uniform_real_distribution<>(0, 0.001)(random));  // work takes time: messages arrive in its midst
    return true;
  }

  void becomeIdle(Node& node) {
    // Where another device's switch stands, it came in between.
    const auto flag = CloudEntry::find(node.machine.entries(), flagKey);
    if (node.daemon && node.expected && !node.merged && flag && flag->device == node.name)
      check(flagOf(node.machine.entries()) == *node.expected, node.name + " has lost a client's last word");
    node.clientCalled = node.merged = false;
    node.expected.reset();
    if (node.daemon) node.daemon->hearthd().lastDelivered.reset();
  }

  // Between what a write was decided on and the write.
  void mergeWithin(Node& node) {
    if (isWithin || !isRunning || !network.nextDue() || !chance(random, 0.05)) return;
    isWithin = true;
    network.now = std::max(network.now, *network.nextDue());
    const std::string before = node.machine.bytes();
    network.deliverNext();
    node.merged = node.merged || node.machine.bytes() != before;
    isWithin = false;
  }

  void deliverFileEvents(Node& node) {
    tick(node);
    watching(node, false, [&] { node.machine.files.deliverEvents(); });
  }

  void deliverMessage() {
    for (auto& node : nodes) tick(*node);
    std::vector<std::string> before;
    for (auto& node : nodes) before.push_back(node->machine.bytes());
    network.deliverNext();
    for (std::size_t index = 0; index < nodes.size(); ++index)
      noteChange(*nodes[index], before[index], false);
  }

  void watching(Node& node, bool isDaemon, const std::function<void()>& work) {
    const std::string before = node.machine.bytes();
    work();
    noteChange(node, before, isDaemon);
  }

  // Who changed the flag, and whether he was allowed to.
  void noteChange(Node& node, const std::string& bytesBefore, bool isDaemon) {
    if (bytesBefore == node.machine.bytes()) return;
    const Dictionary before = Machine::entriesIn(bytesBefore), after = node.machine.entries();
    if (node.machine.bytes() != node.unsure && node.machine.files.failFrom == std::numeric_limits<int>::max())
      acknowledge(after);
    if (!isDaemon) {
      node.merged = true;
      return;
    }
    const auto flag = CloudEntry::find(after, flagKey), former = CloudEntry::find(before, flagKey);
    const auto end = CloudEntry::find(after, endKey);
    if (flag && (!former || former->stamp != flag->stamp)) {
      if (flagOf(before) == flagOf(after)) {
        check(node.clientCalled || node.merged, node.name + " stamps an echo anew");
      } else {
        noteSwitch(node, before, *flag);
      }
    }
    if (node.isBeginning && end && end->value) {
      node.isBeginning = false;
      check(node.merged || end->stamp == flag->stamp,
            node.name + " stamps flag and end time apart: " + platform::describe(before) + " " +
                platform::describe(after));
    }
  }

  void acknowledge(const Dictionary& entries) {
    for (const auto& [key, value] : entries) {
      const auto entry = CloudEntry::fromValue(value);
      auto& best = acknowledged[key];
      if (entry && (!best || entry->outranks(*best))) best = entry;
    }
  }

  void noteSwitch(Node& node, const Dictionary& before, const CloudEntry& flag) {
    const bool is = flagOf({{flagKey, flag.toValue()}});
    const double now = (network.now + node.machine.offset).count();
    const double end = endOf(before);
    node.isBeginning = is && end == 0;
    if (is && end > 0) tookUpAnEnd = true;
    if (!is) node.stoppedInThisLife = true;
    if (!is && end > 0 && end <= now + 1) {
      node.expected.reset();
      const auto former = CloudEntry::find(before, flagKey);
      // After a merge within, what it cleared is not what was there before.
      if (!node.merged) expiries.push_back({flag, former->stamp});
      return;
    }
    if (node.machine.files.failFrom == std::numeric_limits<int>::max()) switches.push_back(flag);
    if (!is && node.daemon->hearthd().lastDelivered) {
      node.expected.reset();
      ++counts.staleAlarmEnds;
      return;
    }
    if (node.clientCalled) return;
    check(node.merged, node.name + (is ? " is switched on" : " is switched off") + " by nobody, its end in " +
                           std::to_string(end - now) + " s");
    ++counts.mergesBetween;
    mayMix = true;
  }

  void settle() {
    int count = 0;
    while (step()) check(++count < 50'000, "the devices do not come to rest");
  }

  // Lets time pass, from one thing that is due to the next.
  void advance(Time duration) {
    const Time target = network.now + duration;
    for (int count = 0;; ++count) {
      check(count < 50'000, "something is scheduled for ever");
      settle();
      const auto due = nextDue();
      if (!due || *due > target) break;
      network.now = std::max(network.now, *due);
      fireDue();
    }
    network.now = target;
    settle();
  }
  std::optional<Time> nextDue() {
    std::optional<Time> next = network.nextDue();
    const auto consider = [&](const std::optional<Time>& due) {
      if (due && (!next || *due < *next)) next = due;
    };
    for (auto& node : nodes) {
      tick(*node);
      if (node->daemon) consider(node->daemon->hearthd().nextDue());
      if (node->sync) consider(node->sync->nextDue());
    }
    return next;
  }
  void fireDue() {
    for (auto& node : nodes) {
      tick(*node);
      if (node->daemon) node->daemon->hearthd().deliverDue();
      if (!node->sync) continue;
      const platform::PlatformScope scope(*node->sync->platform);
      watching(*node, false, [&] { node->sync->synchroniser.timePassed(); });
    }
  }

  // Until nothing but alarms is left.
  void rest() {
    const Time limit = network.now + Time(600);
    for (;;) {
      settle();
      bool isQuiet = network.isQuiet();
      for (auto& node : nodes) isQuiet = isQuiet && !node->sync->nextDue();
      if (isQuiet) return;
      check(network.now < limit, "the account does not come to rest");
      advance(Time(1));
    }
  }

  void compareAll() {
    const Dictionary shared = nodes[0]->machine.entries();
    for (auto& node : nodes) {
      check(node->machine.entries() == shared, node->name + " differs from " + nodes[0]->name + ": " +
                                                   platform::describe(node->machine.entries()) + " and " +
                                                   platform::describe(shared));
      tick(*node);
      // Where the end has just passed, the question itself ends it.
      const double left = endOf(shared) - (network.now + node->machine.offset).count();
      const bool hasJustEnded = flagOf(shared) && endOf(shared) > 0 && left < 0;
      check(hasJustEnded || node->daemon->isOn() == flagOf(shared),
            node->name + " is not as the shared flag");
      compareAlarms(*node, flagOf(shared), endOf(shared));
    }
    for (const auto& [key, best] : acknowledged) {
      const auto entry = CloudEntry::find(shared, key);
      check(entry && !best->outranks(*entry), "a write is lost: " + key);
    }
    comparePair(shared);
    for (const Expiry& expiry : expiries) {
      if (expiry.entry.stamp != CloudEntry::find(shared, flagKey)->stamp) continue;
      for (const CloudEntry& later : switches)
        check(later.stamp <= expiry.ended, "an expiry ends a later switch");
    }
  }

  void compareAlarms(Node& node, bool on, double end) {
    const auto alarms = node.machine.alarms.list();
    const bool rootIsOn = rootFlag(node);
    if (!on) {
      check(alarms.empty() || !node.stoppedInThisLife,
            node.name + " keeps an alarm of a period that it stopped");
      counts.leftAlarms += !alarms.empty();
      counts.leftRootFlags += rootIsOn;
      return;
    }
    check(alarms.size() == 1, node.name + " has " + std::to_string(alarms.size()) + " alarms for one period");
    counts.staleAlarms += alarms[0].date != platform::Date::ofSeconds(end);
    check(rootIsOn, node.name + " is on without its root flag");
  }
  bool rootFlag(Node& node) {
    const auto values = node.daemon->radixController().readPrefKeys({flagKey});
    const Value* flag = values ? platform::find(*values, flagKey) : nullptr;
    return flag && platform::toBool(*flag).value_or(false);
  }

  void comparePair(const Dictionary& shared) {
    const auto flag = CloudEntry::find(shared, flagKey), end = CloudEntry::find(shared, endKey);
    if (!flagOf(shared)) counts.leftEnds += endOf(shared) > 0;
    if (!flagOf(shared) || !end) return;
    if (flag->stamp == end->stamp && flag->device == end->device) return;
    if (mayMix) {
      ++counts.mixes;
    } else {
      check(tookUpAnEnd || cutSwitch, "flag and end time are of two switches");
      ++counts.leftEnds;
    }
  }

  static bool flagOf(const Dictionary& entries) {
    const auto entry = CloudEntry::find(entries, flagKey);
    return entry && entry->value && platform::toBool(*entry->value).value_or(false);
  }
  static double endOf(const Dictionary& entries) {
    const auto entry = CloudEntry::find(entries, endKey);
    return entry && entry->value ? platform::toDouble(*entry->value).value_or(0) : 0;
  }

  Process outside;  // current while what runs is no device's own
  const platform::PlatformScope outsideScope{outside};
  Counts& counts;
  Random random;
  Network network;
  std::vector<std::unique_ptr<Node>> nodes;
  std::map<std::string, std::optional<CloudEntry>>
      acknowledged;  // of each key, the greatest that was durable
  struct Expiry {
    CloudEntry entry;
    platform::linux_::CloudStamp ended;  // of the flag that it cleared
  };
  std::vector<Expiry> expiries;
  std::vector<CloudEntry> switches;  // by persons, and what else may switch
  bool mayMix = false, tookUpAnEnd = false, cutSwitch = false;
  bool isRunning = false, isWithin = false;  // a daemon's item of work; a message in its midst
  int writers = 0;
};

}  // namespace

std::string Event::text() const {
  static constexpr const char* names[] = {"on",
                                          "off",
                                          "override, then on",
                                          "foreign write",
                                          "question",
                                          "kill of pairwelld",
                                          "kill of cloudsyncd",
                                          "kill of both",
                                          "power cut",
                                          "shut down",
                                          "partition",
                                          "heal",
                                          "wait",
                                          "clock leap"};
  return std::string(names[kind]) + ", device " + std::to_string(device);
}

std::vector<Event> drawEvents(std::uint64_t seed, int devices) {
  static constexpr Event::Kind kinds[] = {
      Event::on,        Event::on,        Event::on,       Event::off,  Event::off,
      Event::override_, Event::override_, Event::foreign,  Event::look, Event::killDaemon,
      Event::killSync,  Event::killBoth,  Event::cutPower, Event::away, Event::partition,
      Event::heal,      Event::heal,      Event::wait,     Event::wait, Event::leap};
  Random random(seed);
  std::vector<Event> events(100);
  for (Event& event : events)
    event = {kinds[below(random, static_cast<int>(std::size(kinds)))], below(random, devices), random()};
  return events;
}

std::optional<std::string> run(std::uint64_t seed, const std::vector<Event>& events, int devices,
                               Counts& counts) {
  Counts mine;
  mine.seeds = 1;
  std::optional<std::string> failure;
  try {
    Run run(seed, devices, mine);
    for (const Event& event : events) run.perform(event);
    run.finish();
  } catch (const Failure& caught) {
    failure = caught.text;
  }
  counts.add(mine);
  return failure;
}

std::vector<Event> shorten(std::uint64_t seed, std::vector<Event> events, int devices,
                           const std::string& failure) {
  // Numbers apart, or another fault might take the place of the one that was found.
  const auto kind = [](const std::string& text) { return text.substr(text.find(' '), 24); };
  for (std::size_t size = events.size() / 2; size > 0; size /= 2) {
    for (std::size_t from = 0; from < events.size();) {
      auto fewer = events;
      const auto begin = fewer.begin() + static_cast<std::ptrdiff_t>(from);
      fewer.erase(begin, begin + static_cast<std::ptrdiff_t>(std::min(size, fewer.size() - from)));
      Counts ignored;
      if (const auto found = run(seed, fewer, devices, ignored); found && kind(*found) == kind(failure)) {
        events = std::move(fewer);
      } else {
        from += size;
      }
    }
  }
  return events;
}

void Counts::add(const Counts& other) {
  for (auto field : {&Counts::seeds, &Counts::events, &Counts::crashes, &Counts::powerCuts,
                     &Counts::partitions, &Counts::staleAlarms, &Counts::staleAlarmEnds, &Counts::leftAlarms,
                     &Counts::leftRootFlags, &Counts::mergesBetween, &Counts::mixes, &Counts::leftEnds})
    this->*field += other.*field;
}

std::string Counts::text() const {
  const auto part = [](long count, const char* what) { return std::to_string(count) + " " + what; };
  return part(seeds, "seeds, ") + part(events, "events, ") + part(crashes, "crashes, ") +
         part(powerCuts, "power cuts, ") + part(partitions, "partitions; ") +
         part(staleAlarms, "alarms not re-armed, ") + part(staleAlarmEnds, "periods ended by one, ") +
         part(leftAlarms, "alarms and ") + part(leftRootFlags, "root flags left by an end elsewhere, ") +
         part(mergesBetween, "switches by a merge within a refresh, ") + part(mixes, "pairs mixed by one, ") +
         part(leftEnds, "end times left by a crash");
}

}  // namespace simulation
