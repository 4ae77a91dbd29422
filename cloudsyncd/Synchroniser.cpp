#include "cloudsyncd/Synchroniser.hpp"

#include <algorithm>
#include <functional>
#include <string_view>
#include <utility>

#include "cloudsyncd/core/Document.hpp"
#include "cloudsyncd/core/Replica.hpp"
#include "platform/LogSink.hpp"
#include "platform/linux/CloudReplica.hpp"
#include "platform/linux/SettingsDocument.hpp"

namespace cloudsync {
namespace {

using platform::CloudStore;
using platform::Dictionary;
using platform::Outcome;
using platform::Result;
using platform::linux_::mergeCloudEntries;
using platform::linux_::settingsValues;

constexpr std::size_t refusalsKept = 1024;
const std::string cannotPublish = "nothing can be published: ";

const platform::Logger& log() {
  static const platform::Logger logger = platform::hearthLog("cloud");
  return logger;
}

}  // namespace

Synchroniser::Synchroniser(Surroundings surroundings) : around(std::move(surroundings)) {}

void Synchroniser::connected() {
  isConnected = true;
  problem.clear();
  disconnectedSince.reset();
  sending.succeeded();  // what failed on the former connection says nothing of this one
  std::erase_if(devices, [this](const auto& entry) { return !seen.contains(entry.first); });
  log().default_("connected to account %s", around.account);
  takeIn();
}

void Synchroniser::disconnected(const std::string& problem_) {
  isConnected = false;
  isPublishing = false;
  seen.clear();
  if (!disconnectedSince) disconnectedSince = around.wall.now();
  if (std::exchange(problem, problem_) != problem_) log().error("not connected: %s", problem);
  settle(problem);
  deadlineMoved();
}

void Synchroniser::received(const std::string& name, std::string_view text) {
  seen.insert(name);
  std::string why;
  auto document = decodeDocument(text, around.account, name, around.wall.now(), why);
  if (!document) {
    refuse(name, why);
    // Somebody has written over it. What is refused as it was sent would be so again.
    if (name == ownDevice() && std::hash<std::string_view>()(text) != sentText) {
      devices[name].entries.clear();
      publishIfNews();
    }
    return;
  }
  // An engine may pass on what it does not keep: that is told by its answer.
  if (isPublishing && document->writer == around.writer && document->entries == underWay.entries) return;
  Device& device = devices[name];
  device.problem.clear();
  // An engine may have gone back to an older one, or somebody has put it there; its device may be off.
  const bool hasGoneBack = !newsIn(device.entries, document->entries, around.wall.now()).empty();
  device.entries = std::move(document->entries);
  const auto replica = around.replica.contents();
  if (name == ownDevice() && document->writer != around.writer && !isOwnWriter(*replica, document->writer) &&
      !std::exchange(isForeign, true)) {
    log().error(
        "somebody else publishes under this device's name: it is a copy of another's disk, or was restored "
        "from a "
        "backup. It goes on reading, and publishes again after: hearthctl cloud new-identity");
  }
  // What comes before the connection stands is taken in as one.
  if (!isConnected) return;
  takeIn(device.entries);
  if (hasGoneBack) publishIfNews();
}

void Synchroniser::unreadable(const std::string& device, const std::string& why) {
  seen.insert(device);
  refuse(device, why);
  deadlineMoved();  // the transport's: it may try again
}

void Synchroniser::refuse(const std::string& device, const std::string& why) {
  devices[device].problem = why;
  // A document that comes and goes, or is good in between, would fill the log.
  if (refusals.size() >= refusalsKept) refusals.clear();
  if (refusals.emplace(device, why).second)
    log().error("the document of device %s is refused: %s", device, why);
}

void Synchroniser::removed(const std::string& device) {
  devices.erase(device);
  publishIfNews();
}

Dictionary Synchroniser::allDocuments() const {
  Dictionary all;
  for (const auto& [name, device] : devices) mergeCloudEntries(device.entries, all, around.wall.now());
  return all;
}

std::string Synchroniser::ownDevice() const {
  const auto* device = platform::find<std::string>(*around.replica.contents(), "device");
  return device ? *device : "";
}

void Synchroniser::takeIn() {
  takeIn(allDocuments());
  publishIfNews();
}

void Synchroniser::takeIn(const Dictionary& entries) {
  bool changed = false;
  std::error_code refused;
  auto written = around.replica.update([&](Dictionary& replica) {
    const auto answer = change(replica, entries);
    if (!answer) refused = answer.error();
    return changed = answer && *answer;
  });
  if (refused) written = refused;
  if (!written) return fail(taking, "the replica cannot be written: " + written.error().message());
  taking.succeeded();
  if (changed) lastIn = around.wall.now();
  settle("");
}

// The name outlives a replica that is deleted under us. What a person's edit has left may be no name: nobody
// would look for a document that is called so, and its path may lead elsewhere.
std::string Synchroniser::nameDevice(Dictionary& replica) {
  const auto* name = platform::find<std::string>(replica, "device");
  if (!name || !isName(*name)) replica.erase("device");
  if (!knownDevice.empty() && !replica.contains("device")) replica["device"] = knownDevice;
  return knownDevice = platform::linux_::cloudDeviceOf(replica);
}

// Whether it changes the replica.
Result<bool> Synchroniser::change(Dictionary& replica, const Dictionary& entries) {
  nameDevice(replica);
  const auto account = accountOf(replica);
  if (account == around.account)
    return mergeCloudEntries(entries, settingsValues(replica), around.wall.now());
  if (around.changing) {
    if (const auto allowed = around.changing(); !allowed) return allowed.error();
  }
  if (!account) {
    join(replica, around.account, allDocuments());
  } else {
    if (const auto kept = keepAside(replica, *account); !kept) return kept.error();
    changeAccount(replica, around.account, allDocuments());
  }
  return true;
}

Result<void> Synchroniser::keepAside(const Dictionary& replica, const std::string& account) {
  const auto text = platform::linux_::encodeSettings(replica);
  return text ? platform::linux_::replaceFile(around.files, around.path + ".account-" + account, *text)
              : Result<void>(text.error());
}

void Synchroniser::replicaChanged(const Dictionary& before, const Dictionary& after) {
  if (accountOf(after) != around.account) {
    // Deleted under us. Published as it is, the empty one would read as "off" everywhere.
    if (isConnected) takeIn();
    return;
  }
  if (platform::valueOf(before, "device") != platform::valueOf(after, "device")) isForeign = false;
  publishIfNews();
}

void Synchroniser::publishIfNews() {
  const auto replica = around.replica.contents();
  if (accountOf(*replica) == around.account &&
      !newsIn(settingsValues(*replica), allDocuments(), around.wall.now()).empty())
    pacing.written(around.steady());
  deadlineMoved();
}

std::optional<Steady> Synchroniser::sendingDue() const {
  if (!isConnected || isPublishing || isForeign || !pacing.deadline()) return std::nullopt;
  return std::max(*pacing.deadline(), sending.deadline().value_or(Steady::min()));
}

std::optional<Steady> Synchroniser::deadline() const {
  const auto due = sendingDue();
  if (!due || !taking.deadline()) return due ? due : taking.deadline();
  return std::min(*due, *taking.deadline());
}

void Synchroniser::timePassed() {
  const Steady now = around.steady();
  if (taking.deadline() && *taking.deadline() <= now) {
    taking.begin();
    if (isConnected) takeIn();
  }
  if (const auto due = sendingDue(); due && *due <= now) publish();
}

void Synchroniser::publish() {
  if (accountOf(*around.replica.contents()) != around.account) {
    // Deleted under us, and not reported yet. What this device alone gave the account would go from there,
    // too.
    pacing.sent();
    return takeIn();
  }
  const auto text = encode();
  if (!text) {
    if (text.error() == Outcome::tooLarge) return pacing.sent(), exceedsQuota();
    return fail(sending, cannotPublish + text.error().message());
  }
  pacing.sent();
  isPublishing = true;
  sentText = std::hash<std::string_view>()(*text);
  around.transport.publish(underWay.device, *text);
}

// The replica as a document; before, the file has to know its writer and its name.
Result<std::string> Synchroniser::encode() {
  Result<std::string> text{std::string()};
  const auto written = around.replica.update([&](Dictionary& replica) {
    const auto device = platform::valueOf(replica, "device");
    underWay = {around.account, nameDevice(replica), around.writer,
                publishableEntries(settingsValues(std::as_const(replica)), around.wall.now())};
    text = encodeDocument(underWay);
    if (!text) return false;
    const bool isKnown = isOwnWriter(replica, around.writer);
    if (!isKnown) addWriter(replica, around.writer);
    return !isKnown || platform::valueOf(replica, "device") != device;
  });
  return written ? text : Result<std::string>(written.error());
}

void Synchroniser::published(const std::error_code& error, const std::string& problem_) {
  isPublishing = false;
  deadlineMoved();
  if (error) pacing.written(around.steady());
  if (error == std::errc::message_size) {
    sending.failed(around.steady(), "");  // the engine's limit may be raised
    return exceedsQuota();
  }
  if (error) return fail(sending, cannotPublish + problem_);
  lastOut = around.wall.now();
  isOverQuota = false;
  sending.succeeded();
  devices[underWay.device] = {std::move(underWay.entries), ""};
}

// What was written stays here: until another write makes it smaller, where the quota is the documents' own.
void Synchroniser::exceedsQuota() {
  if (std::exchange(isOverQuota, true)) return;
  log().error("the settings exceed what an account may hold: the change stays on this device");
  const auto told = around.replica.update([](Dictionary& replica) {
    giveReason(replica, CloudStore::ChangeReason::quotaViolation);
    return true;
  });
  if (!told) log().error("%s: %s", around.path, told.error().message());
}

void Synchroniser::fail(Retry& retry, const std::string& text) {
  if (retry.failed(around.steady(), text)) log().error("%s", text);
  settle(text);
  deadlineMoved();
}

void Synchroniser::deadlineMoved() {
  if (around.deadlineMoved) around.deadlineMoved();
}

void Synchroniser::settle(const std::string& text) {
  if (!std::exchange(isSettled, true) && around.settled) around.settled(text);
}

Synchroniser::Status Synchroniser::status() const {
  Status status{isConnected, problem, disconnectedSince, lastOut, lastIn, {}, ownDevice(), devices};
  status.waiting = newsIn(settingsValues(*around.replica.contents()), allDocuments(), around.wall.now());
  if (!isConnected) return status;
  if (isForeign)
    status.problem = "another device publishes under this one's name: hearthctl cloud new-identity";
  if (isOverQuota) status.problem = "the settings exceed what an account may hold";
  for (const Retry* retry : {&sending, &taking}) {
    if (!retry->problem().empty()) status.problem = retry->problem();
  }
  return status;
}

}  // namespace cloudsync
