#include "tests/simulation/Witness.hpp"

#include <cmath>

namespace simulation {

void Witness::wrote(const Work& work) {
  const auto isNew = [&](const std::string& key) {
    const auto entry = CloudEntry::find(work.after, key);
    if (!entry || !authors.contains(name(key, *entry))) return entry;
    // Several write the same end; and what a power cut took may be written again.
    const bool isOwn =
        !work.hasMerged && platform::valueOf(work.before, key) != platform::valueOf(work.after, key);
    return isOwn ? entry : std::nullopt;
  };
  const auto flag = isNew(flagKey), end = isNew(endKey);
  if (flag) wroteFlag(work, *flag);
  if (end && flag) authors[name(endKey, *end)] = authors[name(flagKey, *flag)];
  if (end && !flag) wroteEnd(work, *end);
}

void Witness::wroteFlag(const Work& work, const CloudEntry& flag) {
  const bool on = flagIn(work.after);
  Author author;
  if (work.calls.contains(on) && flag.stamp.tick == 0) {
    persons.push_back(flag);
    author.person = static_cast<int>(persons.size());
  } else {
    check(!on, work.device + " is switched on by nobody");
    author = ended(work, flag);
  }
  author.isTorn = work.isCut;
  author.isBetween = author.isBetween || work.hasMerged;
  authors[name(flagKey, flag)] = author;
}

// Who ended a period that no person did.
Witness::Author Witness::ended(const Work& work, const CloudEntry& flag) {
  const double end = endIn(work.before);
  const auto former = CloudEntry::find(work.before, flagKey),
             formerEnd = CloudEntry::find(work.before, endKey);
  const bool isEndNewer = former && formerEnd && formerEnd->outranks(*former);
  Author author = authorOf(work.before, isEndNewer ? endKey : flagKey);
  author.ended.reset();
  if (work.hasMerged) {
    counts.endsByMerge += flag.stamp.tick == 0;  // otherwise what arrived has ended, too
  } else if (flag.stamp.tick > 0 || (end > 0 && end <= work.from + 1)) {
    author.ended = isEndNewer ? formerEnd : former;
    checkRank(flag, author);
  } else if (work.alarm) {
    counts.staleAlarmEnds += std::floor(*work.alarm) != std::floor(end);
  } else if (work.question && *work.question != end) {
    ++counts.endsByMerge;
    author.isBetween = true;
  } else {
    check(work.question.has_value() || (end > 0 && end <= work.now + 1),
          work.device + " is switched off by nobody, its end in " + std::to_string(end - work.now) + " s");
  }
  return author;
}

// A flag that is there without an end time is given one; what is left of an ended period is cleared.
void Witness::wroteEnd(const Work& work, const CloudEntry& end) {
  const bool isCompletion = !(endIn(work.before) > 0) || !flagIn(work.after);
  check(isCompletion || work.hasMerged || work.hasBegun, work.device + " writes an end time unasked");
  Author author = authorOf(work.after, flagKey);
  author.isTorn = author.isTorn || work.isCut;
  author.isBetween = author.isBetween || work.hasMerged;
  authors[name(endKey, end)] = author;
  const auto flag = CloudEntry::find(work.after, flagKey);
  check(!work.hasBegun || flag->device != work.device || end.stamp == flag->stamp,
        work.device + " stamps a pair apart");
}

// A stale period's end must not end what somebody switched on since.
void Witness::checkRank(const CloudEntry& flag, const Author& author) const {
  if (!author.ended) return;
  for (const CloudEntry& person : persons) {
    check(!person.outranks(*author.ended) || person.outranks(flag),
          flag.device + " ends a newer period of " + person.device);
  }
}

Witness::Author Witness::authorOf(const Dictionary& entries, const std::string& key) const {
  const auto entry = CloudEntry::find(entries, key);
  if (!entry) return {};
  const auto found = authors.find(name(key, *entry));
  check(found != authors.end(), "nobody wrote " + key);
  return found->second;
}

void Witness::checkPair(const std::string& device, const Dictionary& before, const Dictionary& after) const {
  const auto flag = CloudEntry::find(before, flagKey), end = CloudEntry::find(before, endKey);
  const auto isKept = [&](const std::string& key) {
    return platform::valueOf(before, key) == platform::valueOf(after, key);
  };
  if (!flagIn(before) || !end || !isKept(flagKey) || isKept(endKey)) return;
  const bool isPair = end->stamp == flag->stamp && end->device == flag->device;
  check(!isPair || authorOf(before, flagKey).isBetween || authorOf(after, endKey).isBetween,
        device + " parts a switch and its end time: " + platform::describe(after));
}

void Witness::checkShared(const Dictionary& entries) {
  const auto flag = CloudEntry::find(entries, flagKey);
  if (!flag) return;
  const Author author = authorOf(entries, flagKey), ofEnd = authorOf(entries, endKey);
  checkRank(*flag, author);
  const bool isBetween = author.isBetween || ofEnd.isBetween;
  if (flagIn(entries)) {
    counts.mixes += author.person != ofEnd.person;
    // A device that died behind its flag gave it no end time, and another's may have come by then.
    check(author.person == ofEnd.person || author.isTorn || isBetween,
          "flag and end time are of two switches: " + platform::describe(entries));
  } else if (endIn(entries) > 0) {
    ++counts.leftEnds;
    check(author.isTorn || isBetween, "an end time is left: " + platform::describe(entries));
  }
}

}  // namespace simulation
