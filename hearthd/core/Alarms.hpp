// The alarms of all jobs: which are due, which have been delivered, which are done with.
#pragma once

#include <compare>
#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/Value.hpp"

namespace hearth {

// Due times follow the wall clock, waits do not: the clock may be set while one is under way.
struct Moment {
  platform::Time wall{};
  platform::Time steady{};
};

struct EventKey {
  std::string job;
  std::string stream;
  std::string name;
  friend auto operator<=>(const EventKey&, const EventKey&) = default;
};

struct Alarm {
  EventKey key;
  platform::Date date;
  std::int64_t generation = 0;
};

// A plain value. What is on disk are the alarms and the last generation; handlers and deliveries are of this
// run.
class Alarms {
 public:
  // Registers or replaces; the generation of this registration, above all earlier ones.
  std::int64_t set(const EventKey& key, platform::Date date);
  // Events of generations below the answer are stale from now on. A name without an alarm is no error.
  std::int64_t clear(const EventKey& key);
  // Of every job and stream; how many there were.
  std::size_t clearNamed(std::string_view name);

  // From now on the job takes events of the stream. What is overdue waits a second more: the job's own start
  // decides what has passed, and what it registers anew or clears must not be ended by a stale event.
  void handlerInstalled(const std::string& job, const std::string& stream, const Moment& now);
  // Its handlers are gone; what it did not take will be delivered again.
  void jobEnded(const std::string& job);

  // What is to be delivered now; each alarm once a run of its job.
  std::vector<Alarm> takeDue(const Moment& now);
  // When to ask takeDue() again, at the earlier of the two; absent: not before something else happens.
  struct Next {
    std::optional<platform::Time> wall;
    std::optional<platform::Time> steady;
  };
  Next next(const Moment& now) const;

  // The job has handled the event. Removes the alarm, unless it was replaced since; whether it did.
  bool taken(const EventKey& key, std::int64_t generation);

  bool contains(const EventKey& key) const { return entries.count(key) > 0; }
  std::vector<Alarm> list() const;

  platform::Value toValue() const;
  // Absent where the value is not what toValue() makes.
  static std::optional<Alarms> fromValue(const platform::Value& value);

 private:
  struct Entry {
    platform::Date date;
    std::int64_t generation = 0;
    std::optional<platform::Time> heldUntil;  // steady
    bool delivered = false;
  };
  bool deliverable(const EventKey& key, const Entry& entry) const;

  std::map<EventKey, Entry> entries;
  std::int64_t lastGeneration = 0;
  std::set<std::pair<std::string, std::string>> handlers;  // job, stream
};

}  // namespace hearth
