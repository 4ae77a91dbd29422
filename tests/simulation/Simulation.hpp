// One run of an account's devices, drawn from a seed.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace simulation {

// Something from outside. `draw` decides what else is to be decided until the next event, so that the rest of
// a history stays much as it was when others are left out.
struct Event {
  enum Kind {
    on,
    off,
    override_,
    rivals,
    foreign,
    question,
    killDaemon,
    killSync,
    killBoth,
    powerCut,
    shutDown,
    start,
    partition,
    heal,
    loss,
    wait,
    leap
  };
  Kind kind;
  int device;
  std::uint64_t draw;
  std::string text() const;
};

std::vector<Event> drawEvents(std::uint64_t seed, int devices);

// What happened, and how often what is allowed to.
struct Counts {
  long seeds = 0, events = 0, crashes = 0, powerCuts = 0, partitions = 0;
  // A device that is on already does not re-arm its alarm when the end time changes.
  long staleAlarms = 0, staleAlarmEnds = 0;
  // A period that ended elsewhere while the device was down, or a stop that was cut.
  long leftAlarms = 0, leftRootFlags = 0;
  // A merge that fell between a reading and its write: a newer period ended; flag and end time of two.
  long endsByMerge = 0, mixes = 0;
  // An end time beside a flag that is off, as a process died between writing one and the other.
  long leftEnds = 0;

  void add(const Counts& other);
  std::string text() const;
};

// Absent: all held. Otherwise what did not.
std::optional<std::string> run(std::uint64_t seed, const std::vector<Event>& events, int devices,
                               Counts& counts);

// As few of the events as still fail with `failure`.
std::vector<Event> shorten(std::uint64_t seed, std::vector<Event> events, int devices,
                           const std::string& failure);

}  // namespace simulation
