#include "platform/linux/CloudReplica.hpp"

#include <algorithm>
#include <tuple>
#include <utility>

#include "platform/UUID.hpp"
#include "platform/linux/SettingsDocument.hpp"

namespace platform::linux_ {
namespace {

constexpr std::string_view companionSuffix = "Expiration";
// Beyond what any clock says, or the expiry of an expiry needs, and far from overflow: such a stamp is its
// entry's fault.
constexpr std::int64_t greatestStamp = std::int64_t{1} << 61;
constexpr std::int64_t greatestTick = 1 << 20;

std::optional<std::int64_t> stampPart(const Dictionary& entry, std::string_view name, std::int64_t least,
                                      std::int64_t greatest) {
  const auto* number = platform::find<std::int64_t>(entry, name);
  return number && *number >= least && *number <= greatest ? std::optional(*number) : std::nullopt;
}

std::int64_t microsecondsOf(Time time) {
  return static_cast<std::int64_t>(std::clamp(time.count() * 1e6, 0.0, static_cast<double>(greatestStamp)));
}

// The stamp of a burst that begins with `write`: of now, behind everything that is known. Stamps of more than
// a day ahead are some clock's fault, and are not followed, or that clock would rule the others for good;
// only the value that is written over, which has to lose, draws its own along, and its pair's, or the two
// would be stamped apart for ever.
CloudStamp nextStamp(const Dictionary& entries, const CloudWrite& write) {
  constexpr std::int64_t day = 86'400'000'000;
  const std::int64_t now = microsecondsOf(write.now);
  const std::string_view stem = cloudStemOf(write.key);
  CloudStamp next{now, 0};
  for (const auto& [key, value] : entries) {
    const auto entry = CloudEntry::fromValue(value);
    if (!entry || entry->stamp.microseconds < next.microseconds || !entry->stamp.isCredible(write.now))
      continue;
    if (entry->stamp.microseconds > now + day && cloudStemOf(key) != stem) continue;
    next = {std::min(entry->stamp.microseconds + 1, greatestStamp), 0};
  }
  return next;
}

bool sameContents(const std::optional<Value>& a, const std::optional<Value>& b) {
  return a && b ? sameValue(*a, *b) : a.has_value() == b.has_value();
}

bool isEcho(const CloudWrite& write) {
  return write.lastKnown && sameContents(*write.lastKnown, write.value);
}

// The key whose value says when that of `write` ends, if the write clears it and that moment is there. An
// alarm drops the fraction, so it may come up to a second early.
std::optional<std::string> passedCompanion(const Dictionary& entries, const CloudWrite& write) {
  if (write.value && toBool(*write.value).value_or(true)) return std::nullopt;
  std::string companion = write.key + std::string(companionSuffix);
  const auto entry = CloudEntry::find(entries, companion);
  const auto end = entry && entry->value ? toDouble(*entry->value) : std::nullopt;
  return end && *end <= write.now.count() + 1 ? std::optional(companion) : std::nullopt;
}

// A stamp that is nobody's gives way to all that are somebody's.
bool takesThePlaceOf(const CloudEntry& there, const CloudEntry& entry, Time now) {
  const bool isCredible = entry.stamp.isCredible(now);
  return isCredible == there.stamp.isCredible(now) ? entry.outranks(there) : isCredible;
}

bool place(Dictionary& entries, const std::string& key, const CloudEntry& entry, Time now) {
  const auto there = CloudEntry::find(entries, key);
  if (there && !takesThePlaceOf(*there, entry, now)) return false;  // somebody else's is newer
  entries.insert_or_assign(key, entry.toValue());
  return true;
}

// An end time that is not written behind its flag: by one who follows a switch and finds half of it, as its
// writer is slow or was cut off. It ranks as the flag does, whenever it is written, or it would part what
// somebody else has switched on meanwhile; and before the end time that the writer may still give it. Where
// the flag says otherwise by now, what it belonged to has been overtaken, and it is lost with that. Absent:
// it is a write like others.
std::optional<bool> writeEndAlone(Dictionary& entries, const CloudWrite& write) {
  const std::string_view stem = cloudStemOf(write.key);
  const auto flag = CloudEntry::find(entries, stem), there = CloudEntry::find(entries, write.key);
  if (stem == write.key || !flag || !flag->value) return std::nullopt;
  const bool isOn = toBool(*flag->value).value_or(false);
  const bool hasEnd = there && there->value;
  if (isOn != write.value.has_value() || (isOn && hasEnd)) {
    return write.lastKnown ? std::optional(false) : std::nullopt;  // who never looked follows nobody
  }
  if (there && !flag->outranks(*there)) return std::nullopt;
  return place(entries, write.key,
               {write.value, {flag->stamp.microseconds, flag->stamp.tick - isOn}, flag->device}, write.now);
}

std::optional<std::int64_t> number(const Dictionary& document, std::string_view name) {
  const Value* found = platform::find(document, name);
  return found ? toInteger(*found) : std::nullopt;
}

// A reason counts once: when its sequence number is new.
CloudStore::ChangeReason reasonGiven(const Dictionary& before, const Dictionary& after) {
  const auto reason = number(after, "reason");
  const bool isNew = number(after, "reasonSequence") != number(before, "reasonSequence");
  return isNew && reason && *reason >= 1 && *reason <= 3 ? CloudStore::ChangeReason(*reason)
                                                         : CloudStore::ChangeReason::serverChange;
}

}  // namespace

bool CloudStamp::isCredible(Time now) const {
  constexpr Time hundredYears{3.2e9};
  return microseconds <= microsecondsOf(now + hundredYears);
}

std::optional<CloudEntry> CloudEntry::fromValue(const Value& value) {
  const auto* fields = value.as<Dictionary>();
  if (!fields) return std::nullopt;
  const auto microseconds = stampPart(*fields, "time", 0, greatestStamp);
  const auto tick = stampPart(*fields, "tick", -1, greatestTick);
  const auto* device = platform::find<std::string>(*fields, "device");
  const auto stored = valueOf(*fields, "value");
  const bool isRemoved = valueOf(*fields, "removed") == Value(true);
  if (!microseconds || !tick || !device || isRemoved == stored.has_value()) return std::nullopt;
  return CloudEntry{stored, {*microseconds, *tick}, *device};
}

std::optional<CloudEntry> CloudEntry::find(const Dictionary& entries, std::string_view key) {
  const Value* found = platform::find(entries, key);
  return found ? fromValue(*found) : std::nullopt;
}

Value CloudEntry::toValue() const {
  Dictionary fields{{"time", stamp.microseconds}, {"tick", stamp.tick}, {"device", device}};
  fields.emplace(value ? "value" : "removed", value ? *value : Value(true));
  return fields;
}

bool CloudEntry::outranks(const CloudEntry& other) const {
  const auto rank = [](const CloudEntry& entry) {
    return std::tie(entry.stamp.microseconds, entry.device, entry.stamp.tick);
  };
  if (rank(*this) != rank(other)) return rank(*this) > rank(other);
  return describe(toValue()) > describe(other.toValue());
}

std::string_view cloudStemOf(std::string_view key) {
  if (key.ends_with(companionSuffix)) key.remove_suffix(companionSuffix.size());
  return key;
}

std::string cloudDeviceOf(Dictionary& document) {
  Value& device = document["device"];
  if (!device.as<std::string>()) device = UUID::random().text();
  return *device.as<std::string>();
}

Dictionary cloudValues(const Dictionary& entries) {
  Dictionary values;
  for (const auto& [key, value] : entries) {
    const auto entry = CloudEntry::fromValue(value);
    if (entry && entry->value) values.emplace(key, *entry->value);
  }
  return values;
}

bool mergeCloudEntries(const Dictionary& other, Dictionary& into, Time now) {
  bool changed = false;
  for (const auto& [key, value] : other) {
    const auto theirs = CloudEntry::fromValue(value);
    const auto ours = CloudEntry::find(into, key);
    if (!theirs || (ours && !takesThePlaceOf(*ours, *theirs, now))) continue;
    into.insert_or_assign(key, value);
    changed = true;
  }
  return changed;
}

std::vector<CloudReport> cloudReports(const Dictionary& before, const Dictionary& after) {
  using Reason = CloudStore::ChangeReason;
  std::vector<std::string> keys =
      differingKeys(cloudValues(settingsValues(before)), cloudValues(settingsValues(after)));
  const Reason reason = reasonGiven(before, after);
  std::vector<CloudReport> reports;
  if (reason == Reason::quotaViolation) reports.push_back({reason, {}});
  const bool isOwnReport = reason == Reason::initialSync || reason == Reason::accountChange;
  if (isOwnReport || !keys.empty()) {
    reports.push_back({isOwnReport ? reason : Reason::serverChange, std::move(keys)});
  }
  return reports;
}

bool CloudBursts::write(Dictionary& entries, const CloudWrite& write) {
  if (const auto companion = passedCompanion(entries, write)) return expire(entries, write, *companion);
  if (!write.value && write.key == expiring)
    return place(entries, write.key, {{}, stamp, endedDevice}, write.now);
  expiring.clear();  // any other write, an echo too, ends what belongs to the expiry
  const bool isTogether = joins(entries, write);
  if (!isTogether || !isCompanion(write.key)) {
    if (isEcho(write)) return false;
    if (const auto changed = writeEndAlone(entries, write)) return *changed;
  }
  if (!isTogether) stamp = nextStamp(entries, write);
  lastWrite = write.now;
  lastKey = write.key;
  return place(entries, write.key, {write.value, stamp, write.device}, write.now);
}

void CloudBursts::finished(Time now) {
  if (lastWrite) lastWrite = now;
}

// With the stamp of now, a device that was off for days and ends its stale period at boot would end what
// somebody switched on since; and flag and end time of two devices could mix. With the name of the device
// that ends it, it would outrank a switch of the same moment that has won against the one that it ends; so
// all devices write the same. As it outranks nobody, it is no echo as long as there is something to end: were
// only the end time removed, because this process last knew the flag as off, the period would begin anew.
bool CloudBursts::expire(Dictionary& entries, const CloudWrite& write, const std::string& companion) {
  const auto cleared = CloudEntry::find(entries, write.key);
  const auto end = CloudEntry::find(entries, companion);
  const CloudEntry& ended = cleared && cleared->outranks(*end) ? *cleared : *end;
  stamp = ended.stamp;
  if (++stamp.tick > greatestTick) stamp = {stamp.microseconds + 1, 0};
  lastWrite.reset();
  expiring = companion;
  endedDevice = ended.device;
  return !(cleared && sameContents(cleared->value, write.value)) &&
         place(entries, write.key, {write.value, stamp, endedDevice}, write.now);
}

// Of what was written last: the end time of that flag.
bool CloudBursts::isCompanion(std::string_view key) const {
  return key != lastKey && cloudStemOf(key) == lastKey;
}

// What is written together carries one stamp, or the flag and end time of two devices could mix. A second
// value for a key begins the next at once: another process may have published the first. So does an entry
// that somebody else has overtaken, since the write would be lost on it; but for an end time whose flag has
// been overtaken with it: another's switch that arrives between the two writes of one must not lose half. Nor
// do those part the two who have followed or ended the flag meanwhile.
bool CloudBursts::joins(const Dictionary& entries, const CloudWrite& write) const {
  if (!lastWrite || write.now < *lastWrite || write.now - *lastWrite > quiet) return false;
  const auto there = CloudEntry::find(entries, write.key);
  if (!there || there->stamp < stamp) return true;
  const auto flag = CloudEntry::find(entries, lastKey);
  const bool isOurs = flag && flag->stamp == stamp && flag->device == write.device;
  return isCompanion(write.key) && (!isOurs || there->stamp.microseconds == stamp.microseconds);
}

}  // namespace platform::linux_
