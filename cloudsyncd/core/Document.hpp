// What a device publishes: its whole replica, as one document under its own name.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

#include "platform/Result.hpp"
#include "platform/Value.hpp"

namespace cloudsync {

struct Document {
  std::string account;
  std::string device;
  std::string writer;            // a random text of the process that wrote it
  platform::Dictionary entries;  // in the replica's form
};

// Of the encoded document, and of its keys that have a value.
inline constexpr std::size_t documentBytes = 1 << 20;
inline constexpr std::size_t documentKeys = 1024;

// Of a replica's, without those for which decodeDocument() would refuse them all: a person's edit, or a clock
// that was wrong by a lot, may have left them there.
platform::Dictionary publishableEntries(const platform::Dictionary& entries, platform::Time now);

// Outcome::tooLarge beyond the quota.
platform::Result<std::string> encodeDocument(const Document& document);

// `device` is the name under which it was found. Outcome::malformedFile for everything else than a whole
// document of that device, of this account and of the one format that is known; `problem` says why, in words
// that do not vary from one repetition to the next. `now` is this device's clock.
platform::Result<Document> decodeDocument(std::string_view text, const std::string& account,
                                          const std::string& device, platform::Time now,
                                          std::string& problem);

// What accounts and devices may be called: they name folders, files and subjects elsewhere. Letters, digits,
// '-' and '_', '.' but not first; 1 to 64 of them.
bool isName(std::string_view text);

}  // namespace cloudsync
