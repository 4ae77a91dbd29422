#include "cloudsyncd/Member.hpp"

#include <algorithm>
#include <chrono>
#include <utility>

#include "cloudsyncd/core/Document.hpp"
#include "pairwelld/Names.hpp"
#include "platform/LogSink.hpp"
#include "platform/UUID.hpp"
#include "platform/linux/CloudReplica.hpp"

namespace cloudsync {
namespace {

using platform::Dictionary;
using platform::List;
using platform::Result;
using platform::Value;
using platform::linux_::CloudEntry;

Steady steadyNow() { return std::chrono::steady_clock::now(); }

// When the device itself last changed something, in seconds since 1970.
std::optional<double> newestChange(const std::string& name, const Dictionary& entries) {
  std::optional<double> newest;
  for (const auto& [key, value] : entries) {
    const auto entry = CloudEntry::fromValue(value);
    if (!entry || entry->device != name) continue;
    newest = std::max(newest.value_or(0), static_cast<double>(entry->stamp.microseconds) / 1e6);
  }
  return newest;
}

void insertTime(Dictionary& fields, const char* name, const std::optional<platform::Time>& time) {
  if (time) fields.emplace(name, time->count());
}

List describeDevices(const std::map<std::string, Synchroniser::Device>& devices) {
  List rows;
  for (const auto& [name, device] : devices) {
    Dictionary row{{"device", name}};
    if (const auto newest = newestChange(name, device.entries)) row.emplace("newest", *newest);
    if (!device.problem.empty()) row.emplace("problem", device.problem);
    rows.push_back(std::move(row));
  }
  return rows;
}

}  // namespace

Member::Member(platform::linux_::EventLoop& loop_, platform::linux_::FileSystem& files_,
               platform::linux_::Paths paths_)
    : loop(loop_),
      files(files_),
      paths(std::move(paths_)),
      replicaPath(paths.cloudSettings(pairwell::names::cloudStore)),
      writer(platform::UUID::random().text()),
      replica(platform::linux_::SettingsFile::create(files, replicaPath)) {}

bool Member::start() {
  const bool isWatching = replica->startWatching(loop, [this](const auto& before, const auto& after) {
    if (current) current->synchroniser->replicaChanged(before, after);
  });
  std::string wrong;
  const auto membership = readCloudFile(files, paths.cloud(), wrong);
  if (membership) current = connect(*membership, nullptr, nullptr, wrong);
  if (current) return current->synchroniser->start(), isWatching;
  problem = paths.cloud() + ": " + wrong;
  platform::hearthLog("cloud").error("%s; this device is in no account", problem);
  const bool isItsFault = membership || membership.error() == platform::Outcome::malformedFile ||
                          membership.error() == std::errc::no_such_file_or_directory;
  return isWatching && isItsFault;
}

std::unique_ptr<Member::Connection> Member::connect(const Membership& membership,
                                                    std::function<void(const std::string&)> settled,
                                                    std::function<Result<void>()> changing,
                                                    std::string& wrong) {
  auto transport = makeTransport(membership, {files, loop, steadyNow}, wrong);
  if (!transport) return nullptr;
  auto synchroniser = std::make_unique<Synchroniser>(Synchroniser::Surroundings{
      files, replicaPath, *replica, **transport, wall, steadyNow, membership.account, writer,
      std::move(changing), std::move(settled), [this] { rearm(); }});
  return std::make_unique<Connection>(Connection{membership, std::move(*transport), std::move(synchroniser)});
}

// The old account stays in force until the new one has been downloaded and etc/cloud.json names it.
void Member::use(const Membership& membership, std::function<void(const std::string&)> done) {
  if (next) return done("another account is being tried");
  std::string wrong;
  const auto settled = [this, membership, done](std::string failure) {
    if (failure.empty()) failure = nameInFile(membership);
    // The former one ends at once, or it could still take the replica back to its account.
    if (failure.empty()) current = std::move(next);
    if (!failure.empty()) nameFormerInFile(membership);
    // Not here: this is the new synchroniser's own call.
    loop.async([this, done, failure] {
      if (!failure.empty()) next.reset();
      rearm();
      done(failure);
    });
  };
  const auto changing = [this, membership] { return writeCloudFile(files, paths.cloud(), membership); };
  next = connect(membership, settled, changing, wrong);
  if (!next) return done(wrong);
  next->synchroniser->start();
}

// Where the account is the one that the replica has already, nothing has changed but the way to it. Answers
// the problem.
std::string Member::nameInFile(const Membership& membership) {
  std::string ignored;
  const auto there = readCloudFile(files, paths.cloud(), ignored);
  if (there && *there == membership) return "";
  const auto written = writeCloudFile(files, paths.cloud(), membership);
  return written ? "" : paths.cloud() + ": " + written.error().message();
}

// `refused` may be named already, where the replica could not follow: the next start would go there.
void Member::nameFormerInFile(const Membership& refused) {
  std::string ignored;
  const auto there = readCloudFile(files, paths.cloud(), ignored);
  if (!current || !there || *there != refused) return;
  if (const auto restored = nameInFile(current->membership); !restored.empty())
    platform::hearthLog("cloud").error("%s; the next start goes to account %s", restored, refused.account);
}

void Member::forget(const std::string& device, std::function<void(const std::string&)> done) {
  // It becomes part of a path.
  if (!isName(device)) return done("\"" + device + "\" is no device's name");
  if (!current) return done(problem);
  current->transport->forget(device, std::move(done));
}

void Member::rearm() {
  std::optional<Steady> due;
  for (const auto* connection : {current.get(), next.get()}) {
    if (!connection) continue;
    for (const auto& deadline : {connection->synchroniser->deadline(), connection->transport->deadline()}) {
      if (deadline && (!due || *deadline < *due)) due = deadline;
    }
  }
  timer = {};
  if (!due) return;
  const auto delay = std::chrono::ceil<std::chrono::microseconds>(*due - steadyNow());
  timer = loop.callAfter(std::max(delay, std::chrono::microseconds(0)), [this] { timePassed(); });
}

void Member::timePassed() {
  for (const auto* connection : {current.get(), next.get()}) {
    if (!connection) continue;
    connection->transport->timePassed(steadyNow());
    connection->synchroniser->timePassed();
  }
  rearm();
}

Dictionary Member::status() const {
  if (!current) return {{"connected", false}, {"problem", problem}};
  const Synchroniser::Status status = current->synchroniser->status();
  Dictionary fields{{"url", current->membership.url},
                    {"account", current->membership.account},
                    {"connected", status.isConnected},
                    {"device", status.device},
                    {"waiting", List(status.waiting.begin(), status.waiting.end())},
                    {"devices", Value(describeDevices(status.devices))}};
  insertTime(fields, "since", status.disconnectedSince);
  insertTime(fields, "out", status.lastOut);
  insertTime(fields, "in", status.lastIn);
  if (!status.problem.empty()) fields.emplace("problem", status.problem);
  return fields;
}

}  // namespace cloudsync
