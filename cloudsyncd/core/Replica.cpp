#include "cloudsyncd/core/Replica.hpp"

#include <algorithm>
#include <cstdint>
#include <functional>
#include <set>
#include <string_view>
#include <utility>

#include "platform/UUID.hpp"
#include "platform/linux/CloudReplica.hpp"
#include "platform/linux/SettingsDocument.hpp"

namespace cloudsync {
namespace {

using platform::Dictionary;
using platform::List;
using platform::Value;
using platform::linux_::settingsValues;

constexpr std::size_t writersKept = 64;

const List& writersOf(const Dictionary& replica) {
  static const List none;
  const auto* writers = platform::find<List>(replica, "writers");
  return writers ? *writers : none;
}

}  // namespace

std::optional<std::string> accountOf(const Dictionary& replica) {
  const auto* account = platform::find<std::string>(replica, "account");
  return account ? std::optional(*account) : std::nullopt;
}

bool isOwnWriter(const Dictionary& replica, const std::string& writer) {
  const List& writers = writersOf(replica);
  return std::find(writers.begin(), writers.end(), Value(writer)) != writers.end();
}

void addWriter(Dictionary& replica, const std::string& writer) {
  List writers = writersOf(replica);
  // An old document may come back late; one of so many starts ago hardly.
  if (writers.size() >= writersKept) writers.erase(writers.begin());
  writers.emplace_back(writer);
  replica.insert_or_assign("writers", std::move(writers));
}

void giveReason(Dictionary& replica, platform::CloudStore::ChangeReason reason) {
  const Value* last = platform::find(replica, "reasonSequence");
  const std::int64_t sequence = last ? platform::toInteger(*last).value_or(0) : 0;
  replica.insert_or_assign("reason", static_cast<std::int64_t>(reason));
  replica.insert_or_assign("reasonSequence", sequence + 1);
}

void join(Dictionary& replica, const std::string& account, const Dictionary& downloaded) {
  Dictionary entries = downloaded;
  std::set<std::string, std::less<>> stems;
  for (const auto& [key, value] : downloaded) stems.emplace(platform::linux_::cloudStemOf(key));
  for (const auto& [key, value] : settingsValues(std::as_const(replica))) {
    if (!stems.contains(platform::linux_::cloudStemOf(key))) entries.emplace(key, value);
  }
  settingsValues(replica) = std::move(entries);
  replica.insert_or_assign("account", account);
  giveReason(replica, platform::CloudStore::ChangeReason::initialSync);
}

void changeAccount(Dictionary& replica, const std::string& account, const Dictionary& downloaded) {
  settingsValues(replica) = downloaded;
  replica.insert_or_assign("account", account);
  giveReason(replica, platform::CloudStore::ChangeReason::accountChange);
}

void makeNewIdentity(Dictionary& replica) {
  replica.erase("device");
  replica.erase("writers");
  platform::linux_::cloudDeviceOf(replica);
}

std::vector<std::string> newsIn(const Dictionary& entries, const Dictionary& documents, platform::Time now) {
  Dictionary merged = documents;
  platform::linux_::mergeCloudEntries(entries, merged, now);
  return platform::linux_::differingKeys(documents, merged);
}

}  // namespace cloudsync
