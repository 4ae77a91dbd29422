// The files of the stores, the texts that a person has edited, and what a store makes of such a file.
#include "platform/linux/SettingsDocument.hpp"

#include <string>

#include "fuzz/Target.hpp"
#include "platform/linux/CloudReplica.hpp"
#include "platform/linux/FileUserPreferences.hpp"
#include "platform/linux/ReplicaFileCloudStore.hpp"

namespace linux_ = platform::linux_;
using platform::Dictionary;
using platform::Value;

namespace {

Dictionary withoutKey(const Dictionary& document) {
  Dictionary values = linux_::settingsValues(document);
  values.erase("key");
  return values;
}

// A write keeps what could be read; what could not be lies beside it, and the log says where and why.
template <class Create>
void checkWrites(std::string_view text, Create create) {
  fuzz::World world;
  std::string problem;
  const auto before = linux_::decodeSettings(text, problem);
  world.files.put(world.path, text);
  const auto store = create(world);
  static_cast<void>(store->textForKey("key"));
  for (const std::optional<Value>& value : {std::optional(Value(7)), std::optional<Value>()}) {
    store->setValue(value, "key");
    const auto after = linux_::decodeSettings(world.files.bytes(world.path), problem);
    fuzz::require(after.has_value());
    if (before) fuzz::require(linux_::differingKeys(withoutKey(*before), withoutKey(*after)).empty());
  }
  if (before) return;
  fuzz::require(world.files.bytes(world.path + ".damaged-1") == text);
  fuzz::require(world.logged().front().find(world.path + ": line ") != std::string::npos);
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const auto text = fuzz::textOf(data, size);
  for (const auto decode : {linux_::decodeSettings, linux_::decodeEditedSettings}) {
    std::string problem;
    const auto document = decode(text, problem);
    fuzz::require(document || problem.starts_with("line "));
    if (!document) continue;
    // What can be read can be kept, and is the same again.
    const auto kept = linux_::encodeSettings(*document);
    fuzz::require(kept.has_value());
    const auto again = linux_::decodeSettings(*kept, problem);
    fuzz::require(again && *linux_::encodeSettings(*again) == *kept);
    fuzz::require(linux_::differingKeys(*document, *again).empty());
    static_cast<void>(linux_::cloudReports({}, *document));
  }
  checkWrites(text, [](fuzz::World& world) {
    return linux_::FileUserPreferences::create(world.files, nullptr, world.path);
  });
  checkWrites(text, [](fuzz::World& world) {
    return linux_::ReplicaFileCloudStore::create(world.files, nullptr, world.device.centre,
                                                 world.device.manualClock, world.path);
  });
  return 0;
}
