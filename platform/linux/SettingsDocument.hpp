// What a settings file says: its form, and what differs between two.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "platform/Result.hpp"
#include "platform/Value.hpp"

namespace platform::linux_ {

// The file is an object with "checksum", "values" and whatever else its writers keep there; a document is
// that object without the checksum.
Result<std::string> encodeSettings(const Dictionary& document);

// Outcome::malformedFile for what does not parse or, where there is a checksum, does not match it; `problem`
// says what and where. A missing checksum is a person's edit.
Result<Dictionary> decodeSettings(std::string_view text, std::string& problem);

// The same for a text that a person has just edited: its checksum is a wrong one by now, and is dropped.
Result<Dictionary> decodeEditedSettings(std::string_view text, std::string& problem);

// A document's "values"; the second makes them if need be.
const Dictionary& settingsValues(const Dictionary& document);
Dictionary& settingsValues(Dictionary& document);

// Whether both print alike in a file. Stricter than a reader, to whom 1, 1.0 and true may be one; and a
// number that is not one is itself here, or a stored one would count as changed for ever.
bool sameValue(const Value& a, const Value& b);

// The keys that only one of the two has, or whose values differ; sorted.
std::vector<std::string> differingKeys(const Dictionary& a, const Dictionary& b);

// Makes the changes that lead from one document to another in a third, too; those of "values" key by key.
void carryOver(const Dictionary& before, const Dictionary& after, Dictionary& into);

}  // namespace platform::linux_
