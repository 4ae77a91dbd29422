// The files of the stores, and the texts that a person has edited.
#include "platform/linux/SettingsDocument.hpp"

#include <string>

#include "fuzz/Target.hpp"
#include "platform/linux/CloudReplica.hpp"

namespace linux_ = platform::linux_;

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  for (const auto decode : {linux_::decodeSettings, linux_::decodeEditedSettings}) {
    std::string problem;
    const auto document = decode(fuzz::textOf(data, size), problem);
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
  return 0;
}
