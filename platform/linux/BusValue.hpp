// Property values to and from messages of the D-Bus format, by signature.
#pragma once

#include <string_view>

#include "platform/Result.hpp"
#include "platform/Value.hpp"

struct sd_bus_message;

namespace platform::linux_ {

// b is a boolean; y, n, q, i, u, x, t integers (t beyond 63 bits is an error); d a double; s, o, g texts; a
// list for an array or a structure. The values must fit the signature.
Result<void> appendValues(sd_bus_message* message, std::string_view signature, const List& values);
Result<List> readValues(sd_bus_message* message, std::string_view signature);

}  // namespace platform::linux_
