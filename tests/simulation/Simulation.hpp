// One run of an account's devices, drawn from a seed, and what must hold throughout and at its end.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "tests/simulation/Device.hpp"

namespace simulation {

// Something from outside. `draw` decides how it interleaves with what is under way, so that the rest of a
// history stays as it was when others are left out.
struct Event {
  enum Kind {
    on,
    off,
    override_,
    foreign,
    look,
    killDaemon,
    killSync,
    killBoth,
    cutPower,
    away,
    partition,
    heal,
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
  // A period that ended elsewhere while the device was down.
  long leftAlarms = 0, leftRootFlags = 0;
  // A merge that fell between a refresh's reading and its write.
  long mergesBetween = 0, mixes = 0;
  // An end time that a crash between two steps left.
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
