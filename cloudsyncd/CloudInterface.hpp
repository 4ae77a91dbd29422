// What cloudsyncd serves on its socket.
#pragma once

#include <string_view>

#include "platform/linux/BusServer.hpp"

namespace cloudsync {

inline constexpr std::string_view cloudService = "com.kestrel.cloudsync";

// The operations; the numbers are indices into cloudInterface().operations. All are root's and cloudsyncd's
// own user's.
//
//   Status → s     one JSON object: "url", "account", "connected", "since" (of the disconnection), "problem",
//                  "out" and "in" (the last exchanges), "device" (this one), "waiting" (keys that have yet to
//                  go out), "devices", a list of {"device", "newest" (its newest change), "problem"}; times
//                  in seconds since 1970, what does not apply is left out
//   Use s          the contents that etc/cloud.json is to have: answered once that account has been taken in,
//                  or with why it can't be, and then everything is as it was
//   Forget s       takes the document of a lost device out of the account
//
// Errors are hearthd's notPermittedError and failedError.
enum class CloudOperation { status, use, forget };

const platform::linux_::BusInterface& cloudInterface();

}  // namespace cloudsync
