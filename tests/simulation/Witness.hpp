// Knows who wrote what on any device, and says when something was written that nobody was to write.
#pragma once

#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "tests/simulation/Device.hpp"
#include "tests/simulation/Simulation.hpp"

namespace simulation {

struct Failure {
  std::string text;
};
inline void check(bool holds, const std::string& text) {
  if (!holds) throw Failure{text};
}

// One item of a daemon's work, and what it had been asked for by then.
struct Work {
  std::string device;
  Dictionary before, after;  // the replica's entries
  double from = 0, now = 0;  // by the device's clock, at the item's begin and end
  bool isCut = false;        // the process died within it
  bool hasBegun = false;     // it has written its flag, and been told of before
  bool hasMerged = false;    // another device's switch arrived within it
  std::set<bool> calls;      // what clients switched to
  // The end times that an alarm or a client's question found passed; kept until the switch that follows.
  std::optional<double> alarm, question;
};

class Witness {
 public:
  explicit Witness(Counts& counts_) : counts(counts_) {}

  void wrote(const Work& work);
  // As long as its flag stands, a switch keeps the end time that was written with it.
  void checkPair(const std::string& device, const Dictionary& before, const Dictionary& after) const;
  // Flag and end time of the shared replica, at rest: of one switch, and no stale end of a newer one.
  void checkShared(const Dictionary& entries);

 private:
  // Of an entry.
  struct Author {
    int person = 0;  // whose switch it belongs to, be it its end
    bool isTorn = false, isBetween = false;
    std::optional<CloudEntry> ended;  // the newer one of the entries that it ends by their end time
  };
  void wroteFlag(const Work& work, const CloudEntry& flag);
  void wroteEnd(const Work& work, const CloudEntry& end);
  Author ended(const Work& work, const CloudEntry& flag);
  void checkRank(const CloudEntry& flag, const Author& author) const;
  static std::string name(const std::string& key, const CloudEntry& entry) {
    return key + platform::describe(entry.toValue());
  }
  Author authorOf(const Dictionary& entries, const std::string& key) const;

  Counts& counts;
  std::map<std::string, Author> authors;
  std::vector<CloudEntry> persons;  // the flags that they wrote, each by its number less one
};

}  // namespace simulation
