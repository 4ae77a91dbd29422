// The three stores of settings, called sources.
#pragma once

#include "platform/RawValue.hpp"

namespace pairwell {

enum class KeyValueSource {
  cloud,  // shared by the user's devices
  root,   // the Bluetooth stack's
  user,   // the daemon's own
};

}  // namespace pairwell

template <>
inline constexpr platform::RawValues<pairwell::KeyValueSource, 3>
    platform::rawValues<pairwell::KeyValueSource> = {{{pairwell::KeyValueSource::cloud, "cloud"},
                                                      {pairwell::KeyValueSource::root, "root"},
                                                      {pairwell::KeyValueSource::user, "user"}}};
