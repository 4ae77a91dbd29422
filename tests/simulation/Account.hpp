// The devices of an account on one clock: who works next, when time passes, and what holds at rest.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "tests/simulation/Simulation.hpp"
#include "tests/simulation/Witness.hpp"

namespace simulation {

// A check that fails throws.
class Account {
 public:
  Account(std::uint64_t seed, int devices, Counts& counts);
  void perform(const Event& event);
  // Everything is there and heals; then nothing is left to do.
  void finish();

 private:
  struct Node {
    Machine machine;
    std::string name;
    std::unique_ptr<Pairwelld> daemon;
    std::unique_ptr<Cloudsyncd> sync;
    // Since it was last idle: what clients switched to, an end that was asked for, and the last call, unless
    // something else may decide by now.
    std::set<bool> calls;
    std::optional<double> question;
    std::optional<bool> lastCall;
    // Of the daemon's item of work: the entries that it began with, or that have been told of; whether a flag
    // of its own is among them, and whether others' have arrived.
    std::shared_ptr<const Dictionary> before;
    double from = 0;  // by its clock
    bool hasBegun = false, hasMerged = false;
    bool wasOn = false, hasStopped = false;  // in this life
    // The replica's entries that have been acknowledged; and those that a crash left without a word.
    std::shared_ptr<const Dictionary> kept, unsure;
  };
  Node& at(int index) { return *nodes[static_cast<std::size_t>(index)]; }
  bool draw(double odds) { return chance(random, odds); }
  int draw(int limit) { return below(random, limit); }
  double draw(double from, double to) { return std::uniform_real_distribution<>(from, to)(random); }

  void boot(Node& node);
  void apply(const Event& event, Node& node);
  void say(Node& node, bool on);
  void setOverride(Node& node);
  void writeForeign(Node& node);
  void ask(Node& node);
  void crash(Event::Kind kind, Node& node);
  void cut(Node& node, bool isCut);

  void tick(Node& node);
  bool step();
  void runDaemon(Node& node, const std::function<void()>& work);
  void runSync(Node& node, const std::function<void()>& work);
  void noteWork(Node& node);
  void noteKept(Node& node);
  void noteMerge(Node& node, const Dictionary& before);
  void becomeIdle(Node& node);
  void workTakesTime(Node& node);
  void othersWork();
  void deliverMessage();

  void settle();
  void advance(double seconds);
  std::optional<Time> nextDue();
  void fireDue();
  void rest();
  void checkRest();
  void compareAll();
  void compareAlarms(Node& node, bool on, double end);
  void passEnd();

  fakes::FakePlatform outside;  // current while what runs is no device's own
  const platform::PlatformScope outsideScope{outside};
  Counts& counts;
  Witness witness{counts};
  Random random;
  Network network;
  std::vector<std::unique_ptr<Node>> nodes;
  Node* running = nullptr;  // whose daemon is at work
  bool isPaused = false;    // in its midst, while messages come
  long locks = 0;           // each precedes a write
  int writers = 0;
};

}  // namespace simulation
