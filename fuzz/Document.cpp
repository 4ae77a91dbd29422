// Another device's document, taken into a replica that a person then writes to.
#include "cloudsyncd/core/Document.hpp"

#include <string>

#include "cloudsyncd/core/Replica.hpp"
#include "fuzz/Target.hpp"
#include "platform/linux/CloudReplica.hpp"

namespace linux_ = platform::linux_;
using platform::Dictionary;

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const platform::Time now(1.8e9);
  std::string problem;
  const auto document = cloudsync::decodeDocument(fuzz::textOf(data, size), "home", "other", now, problem);
  fuzz::require(document || !problem.empty());
  if (!document) return 0;

  Dictionary entries = document->entries;
  fuzz::require(!linux_::mergeCloudEntries(document->entries, entries));
  linux_::CloudBursts bursts;
  for (const auto& [key, value] : document->entries) {
    // Whoever has seen a value can write over it, and everybody believes him.
    fuzz::require(bursts.write(entries, {key, platform::Value("mine"), std::nullopt, now, "me"}));
    Dictionary elsewhere = document->entries;
    linux_::mergeCloudEntries(entries, elsewhere);
    fuzz::require(platform::valueOf(linux_::cloudValues(elsewhere), key) == platform::Value("mine"));
  }
  Dictionary replica{{"device", "me"}};
  cloudsync::join(replica, "home", document->entries);
  return 0;
}
