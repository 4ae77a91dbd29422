// What the cloud replica's entries mean, and how a write or another device's document changes them; no I/O.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Stores.hpp"
#include "platform/Value.hpp"

namespace platform::linux_ {

// A hybrid logical timestamp. Ordinary writes count in `microseconds` alone: the clock's, or one more than
// the greatest that the replica knows, those left out that are more than a day ahead of the clock. `tick` is
// left to expiries, which rank right after what they end and before anything else, and, as -1, to the end
// time that a follower gives a flag, which ranks right before that of the flag's own writer.
struct CloudStamp {
  std::int64_t microseconds = 0;  // since 1970
  std::int64_t tick = 0;
  friend auto operator<=>(const CloudStamp&, const CloudStamp&) = default;

  // No clock is a hundred years ahead of another: what claims to be could have the last of all stamps, and
  // nobody could write over it. No device accepts it of another.
  bool isCredible(Time now) const;
};

// What one key holds, in a file {"value": v, "time": n, "tick": n, "device": d}, or "removed": true for the
// value.
struct CloudEntry {
  std::optional<Value>
      value;  // absent: a tombstone, kept so that the removal wins over older values elsewhere
  CloudStamp stamp;
  std::string device;  // that wrote it; of an expiry, that wrote what ended

  // Absent where `value` is no entry; such a one counts as not there.
  static std::optional<CloudEntry> fromValue(const Value& value);
  static std::optional<CloudEntry> find(const Dictionary& entries, std::string_view key);
  Value toValue() const;

  // By microseconds, device, tick. A total order, but for equals: replicas must not differ for ever, even if
  // two values carry one stamp.
  bool outranks(const CloudEntry& other) const;
};

// What a key and its companion, the key's name with "Expiration", have in common.
std::string_view cloudStemOf(std::string_view key);

// The name of the device that `document`, the whole replica, belongs to; made with its first write.
std::string cloudDeviceOf(Dictionary& document);

// The values that are there, tombstones left out.
Dictionary cloudValues(const Dictionary& entries);

// Takes, key by key, the greater of the two, one that is not credible being less than all that are, and says
// whether that changed `into`. Commutative, associative, idempotent: order, repetition and loss of documents
// do not matter.
bool mergeCloudEntries(const Dictionary& other, Dictionary& into, Time now);

// What to tell of a change from elsewhere. Where the account, the first download or the quota changed the
// document, it says so ("reason", told once for each "reasonSequence"), which is news even without a key.
// What a quota is told for is not read further by those who hear of it, so keys that changed meanwhile get a
// report of their own.
struct CloudReport {
  CloudStore::ChangeReason reason;
  std::vector<std::string> keys;
};
std::vector<CloudReport> cloudReports(const Dictionary& before, const Dictionary& after);

struct CloudWrite {
  std::string key;
  std::optional<Value> value;  // absent: a removal
  // What this process last read or wrote for the key (a removal, or nothing found, being an absent value);
  // absent if it never did.
  std::optional<std::optional<Value>> lastKnown;
  Time now;
  std::string device;
};

// One process's writes, and the timestamps that they share. A plain value: a write that fails is undone by
// keeping the former one.
class CloudBursts {
 public:
  static constexpr Time quiet{0.025};

  // Makes `write` in `entries`, and says whether that changed them. It does not where the write is an echo: a
  // device that follows another's switch writes the same values back, which must not outrank what a person
  // did meanwhile. Only an end time that is written behind its flag is none: they carry one stamp. Nor does
  // it where the flag that an end time belonged to was an echo, and has been overtaken.
  bool write(Dictionary& entries, const CloudWrite& write);
  // The write is durable. The quiet counts from here: a slow disk must not part what is written together.
  void finished(Time now);

 private:
  bool expire(Dictionary& entries, const CloudWrite& write, const std::string& companion);
  bool joins(const Dictionary& entries, const CloudWrite& write) const;
  bool isCompanion(std::string_view key) const;

  CloudStamp stamp;
  std::optional<Time> lastWrite;  // absent: there is no burst that a write could join
  std::string lastKey;            // that it wrote
  std::string expiring;           // the companion whose removal belongs to the last expiry
  std::string endedDevice;        // of what that ended
};

}  // namespace platform::linux_
