// Documents of two other devices and this one's replica, with a line "---" between them: taken in from the
// account's folder, and published.
#include "cloudsyncd/core/Document.hpp"

#include <string>
#include <vector>

#include "cloudsyncd/DirectoryTransport.hpp"
#include "cloudsyncd/Synchroniser.hpp"
#include "cloudsyncd/core/Replica.hpp"
#include "fuzz/Target.hpp"
#include "platform/linux/CloudReplica.hpp"
#include "platform/linux/SettingsDocument.hpp"

namespace linux_ = platform::linux_;
using platform::Dictionary;

namespace {

constexpr platform::Time now{1.8e9};
const std::string folder = "/shared";
std::string pathOf(const std::string& device) { return folder + "/home/" + device + ".json"; }

std::optional<Dictionary> entriesOf(std::string_view text, const std::string& device) {
  std::string problem;
  const auto document = cloudsync::decodeDocument(text, "home", device, now, problem);
  fuzz::require(document || !problem.empty());
  return document ? std::optional(document->entries) : std::nullopt;
}

Dictionary merged(const Dictionary& first, Dictionary into) {
  linux_::mergeCloudEntries(first, into, now);
  return into;
}

// Whoever has seen a value can write over it, and everybody believes him.
void checkWrites(const Dictionary& entries) {
  Dictionary own = entries;
  linux_::CloudBursts bursts;
  for (const auto& [key, value] : entries) {
    fuzz::require(bursts.write(own, {key, platform::Value("mine"), std::nullopt, now, "me"}));
    const auto everywhere = linux_::cloudValues(merged(own, entries));
    fuzz::require(platform::valueOf(everywhere, key) == platform::Value("mine"));
  }
}

struct Device : fuzz::World {
  Device() {
    device.manualClock.time = now;
    replica->startWatching(*device.delivery, [this](const Dictionary& before, const Dictionary& after) {
      synchroniser.replicaChanged(before, after);
    });
  }
  cloudsync::Synchroniser::Status live() {
    synchroniser.start();
    for (int minutes = 0; minutes < 5; ++minutes) {
      deliver();
      steady += std::chrono::minutes(1);
      transport->timePassed(steady);
      synchroniser.timePassed();
    }
    deliver();
    return synchroniser.status();
  }

  cloudsync::Steady steady;
  const std::shared_ptr<linux_::SettingsFile> replica = linux_::SettingsFile::create(files, path);
  const std::shared_ptr<cloudsync::DirectoryTransport> transport = cloudsync::DirectoryTransport::create(
      files, *device.delivery, [this] { return steady; }, {folder, "home", std::nullopt});
  cloudsync::Synchroniser synchroniser{
      {files, path, *replica, *transport, device.manualClock, [this] { return steady; }, "home", "writer"}};
};

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  constexpr std::string_view line = "\n---\n";
  std::vector<std::string_view> parts;
  for (std::string_view rest = fuzz::textOf(data, size); parts.size() < 3;) {
    parts.push_back(rest.substr(0, rest.find(line)));
    rest.remove_prefix(std::min(rest.size(), parts.back().size() + line.size()));
  }
  const auto other = entriesOf(parts[0], "other"), third = entriesOf(parts[1], "third");
  if (other && third)
    fuzz::require(linux_::differingKeys(merged(*other, *third), merged(*third, *other)).empty());
  if (other) checkWrites(*other);

  Device self;
  self.files.put(pathOf("other"), parts[0]);
  self.files.put(pathOf("third"), parts[1]);
  if (!parts[2].empty()) self.files.put(self.path, parts[2]);
  const auto status = self.live();
  fuzz::require(status.isConnected);
  std::string problem;
  if (!parts[2].empty() && !linux_::decodeSettings(parts[2], problem))
    fuzz::require(self.files.bytes(self.path + ".damaged-1") == parts[2]);
  if (!status.problem.empty()) return 0;
  // It has what they have, and they can have what it has.
  const Dictionary own = linux_::settingsValues(*self.replica->contents());
  for (const auto& entries : {other, third})
    fuzz::require(!entries || cloudsync::newsIn(*entries, own, now).empty());
  fuzz::require(status.waiting.empty());
  if (status.device == "other" || status.device == "third" || !self.files.exists(pathOf(status.device)))
    return 0;
  const auto told = testing::Contains(testing::HasSubstr("device " + status.device + " is refused"));
  fuzz::require(cloudsync::isName(status.device) &&
                (entriesOf(self.files.bytes(pathOf(status.device)), status.device) ||
                 testing::Value(self.logged(), told)));
  return 0;
}
