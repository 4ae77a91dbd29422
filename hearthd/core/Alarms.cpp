#include "hearthd/core/Alarms.hpp"

#include <algorithm>
#include <chrono>

namespace hearth {
namespace {

using platform::Time;

constexpr Time overdueWait = std::chrono::seconds(1);

Time due(platform::Date date) { return Time(static_cast<double>(date.nanoseconds) / 1e9); }

void lower(std::optional<Time>& least, Time time) { least = least ? std::min(*least, time) : time; }

}  // namespace

std::int64_t Alarms::set(const EventKey& key, platform::Date date) {
  entries[key] = Entry{date, ++lastGeneration, std::nullopt, false};
  return lastGeneration;
}

std::int64_t Alarms::clear(const EventKey& key) {
  entries.erase(key);
  return ++lastGeneration;
}

std::size_t Alarms::clearNamed(std::string_view name) {
  return std::erase_if(entries, [&](const auto& entry) { return entry.first.name == name; });
}

void Alarms::handlerInstalled(const std::string& job, const std::string& stream, const Moment& now) {
  handlers.emplace(job, stream);
  for (auto& [key, entry] : entries) {
    if (key.job != job || key.stream != stream || entry.delivered) continue;
    if (due(entry.date) <= now.wall) entry.heldUntil = now.steady + overdueWait;
  }
}

void Alarms::jobEnded(const std::string& job) {
  std::erase_if(handlers, [&](const auto& handler) { return handler.first == job; });
  for (auto& [key, entry] : entries) {
    if (key.job != job) continue;
    entry.delivered = false;
    entry.heldUntil.reset();
  }
}

bool Alarms::deliverable(const EventKey& key, const Entry& entry) const {
  return !entry.delivered && handlers.count({key.job, key.stream}) > 0;
}

std::vector<Alarm> Alarms::takeDue(const Moment& now) {
  std::vector<Alarm> found;
  for (auto& [key, entry] : entries) {
    if (!deliverable(key, entry) || due(entry.date) > now.wall) continue;
    if (entry.heldUntil && now.steady < *entry.heldUntil) continue;
    entry.delivered = true;
    found.push_back({key, entry.date, entry.generation});
  }
  return found;
}

Alarms::Next Alarms::next(const Moment& now) const {
  Next next;
  for (const auto& [key, entry] : entries) {
    if (!deliverable(key, entry)) continue;
    if (entry.heldUntil && now.steady < *entry.heldUntil) {
      lower(next.steady, *entry.heldUntil);
    } else {
      lower(next.wall, due(entry.date));
    }
  }
  return next;
}

bool Alarms::taken(const EventKey& key, std::int64_t generation) {
  const auto found = entries.find(key);
  if (found == entries.end() || found->second.generation != generation) return false;
  entries.erase(found);
  return true;
}

std::vector<Alarm> Alarms::list() const {
  std::vector<Alarm> all;
  for (const auto& [key, entry] : entries) all.push_back({key, entry.date, entry.generation});
  return all;
}

platform::Value Alarms::toValue() const {
  platform::List alarms;
  for (const auto& [key, entry] : entries) {
    alarms.push_back(platform::Dictionary{{"job", key.job},
                                          {"stream", key.stream},
                                          {"name", key.name},
                                          {"date", entry.date},
                                          {"generation", entry.generation}});
  }
  return platform::Dictionary{{"alarms", std::move(alarms)}, {"lastGeneration", lastGeneration}};
}

std::optional<Alarms> Alarms::fromValue(const platform::Value& value) {
  const auto* whole = value.as<platform::Dictionary>();
  if (!whole) return std::nullopt;
  const auto* last = platform::find<std::int64_t>(*whole, "lastGeneration");
  const auto* list = platform::find<platform::List>(*whole, "alarms");
  // Half of the range is more registrations than will ever be made, and leaves room to count on.
  constexpr std::int64_t greatest = std::int64_t{1} << 62;
  if (!last || !list || *last > greatest) return std::nullopt;
  Alarms alarms;
  alarms.lastGeneration = *last;
  for (const platform::Value& element : *list) {
    const auto* entry = element.as<platform::Dictionary>();
    if (!entry) return std::nullopt;
    const auto* job = platform::find<std::string>(*entry, "job");
    const auto* stream = platform::find<std::string>(*entry, "stream");
    const auto* name = platform::find<std::string>(*entry, "name");
    const auto* date = platform::find<platform::Date>(*entry, "date");
    const auto* generation = platform::find<std::int64_t>(*entry, "generation");
    if (!job || !stream || !name || !date || !generation || *generation > *last) return std::nullopt;
    alarms.entries[{*job, *stream, *name}] = Entry{*date, *generation, std::nullopt, false};
  }
  return alarms;
}

}  // namespace hearth
