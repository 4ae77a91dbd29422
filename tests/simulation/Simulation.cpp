#include "tests/simulation/Simulation.hpp"

#include <algorithm>
#include <iterator>

#include "tests/simulation/Account.hpp"

namespace simulation {

std::string Event::text() const {
  static constexpr const char* names[] = {"on",
                                          "off",
                                          "override, then on",
                                          "on at two devices",
                                          "foreign write",
                                          "question",
                                          "kill of pairwelld",
                                          "kill of cloudsyncd",
                                          "kill of both",
                                          "power cut",
                                          "shut down",
                                          "start",
                                          "partition",
                                          "heal",
                                          "loss of the document",
                                          "wait",
                                          "clock leap"};
  return std::string(names[kind]) + ", device " + std::to_string(device);
}

std::vector<Event> drawEvents(std::uint64_t seed, int devices) {
  using enum Event::Kind;
  static constexpr Event::Kind kinds[] = {
      on,     on,        off,      off,        off,      override_, override_, rivals,   rivals,
      rivals, foreign,   question, killDaemon, killSync, killBoth,  powerCut,  powerCut, shutDown,
      start,  partition, heal,     heal,       loss,     wait,      wait,      leap};
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
    Account account(seed, devices, mine);
    for (const Event& event : events) account.perform(event);
    account.finish();
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
                     &Counts::leftRootFlags, &Counts::endsByMerge, &Counts::mixes, &Counts::leftEnds})
    this->*field += other.*field;
}

std::string Counts::text() const {
  const auto part = [](long count, const char* what) { return std::to_string(count) + " " + what; };
  return part(seeds, "seeds, ") + part(events, "events, ") + part(crashes, "crashes, ") +
         part(powerCuts, "power cuts, ") + part(partitions, "partitions; ") +
         part(staleAlarms, "alarms not re-armed, ") + part(staleAlarmEnds, "periods ended by one; ") +
         part(leftAlarms, "alarms and ") +
         part(leftRootFlags, "root flags left by a stop elsewhere or cut; ") +
         part(endsByMerge, "periods ended and ") + part(mixes, "mixed by a merge before a write; ") +
         part(leftEnds, "end times left by a crash");
}

}  // namespace simulation
