// JSON as all files of this system use it.
#pragma once

#include <string>
#include <string_view>

#include "platform/Result.hpp"
#include "platform/Value.hpp"

namespace platform::linux_ {

// One value. At most 32 levels, no duplicate keys, finite numbers (integers beyond 64 bits are doubles),
// valid UTF-8; else Outcome::malformedFile, and `problem` says what and at which line and column. What JSON
// cannot say (dates, non-finite doubles) is a one-entry object: {"$date": nanoseconds}, {"$double": "inf"}.
Result<Value> parseJson(std::string_view text, std::string& problem);

enum class JsonStyle { line, indented };

// What parseJson() reads back as the same value. Invalid UTF-8 is replaced; deeper than 32 levels is an
// error.
Result<std::string> printJson(const Value& value, JsonStyle style);

}  // namespace platform::linux_
