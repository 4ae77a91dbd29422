// What the daemon and its neighbours, hearthd's job file, the clients and the operator's tools, call things.
#pragma once

#include <string_view>

namespace pairwell::names {

inline constexpr std::string_view job = "com.kestrel.pairwelld";
// What clients connect to.
inline constexpr std::string_view service = "com.kestrel.pairwell.conduit";
// Grants a client all operations of the service.
inline constexpr std::string_view systemEntitlement = "com.kestrel.bluetooth.system";
inline constexpr std::string_view cloudStore = "com.kestrel.bluetooth.cloud.settings";

// Named notifications, system-wide: limited logging has been switched; the root preferences have changed, by
// whoever's hand; the daemon has changed them.
inline constexpr std::string_view settingsChanged = "com.kestrel.pairwell.settingsChanged";
inline constexpr std::string_view rootPrefsChanged = "com.kestrel.bluetooth.prefsChanged";
inline constexpr std::string_view prefsChanged = "com.kestrel.pairwell.prefsChanged";

}  // namespace pairwell::names
