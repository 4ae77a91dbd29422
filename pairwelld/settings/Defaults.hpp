// The settings keys; KeyValueStoreManager::Defaults is their name in the daemon.
#pragma once

#include "platform/RawValue.hpp"

namespace pairwell {

enum class Defaults {
  // Boolean, written to root and cloud, read from cloud: audio-accessory limited logging is on.
  velaLogCloudCollectionEnabled,
  // Double, in cloud: its end time in seconds since 1970.
  velaLogCloudCollectionEnabledExpiration,
  // Double, read from user: its length in seconds where that is greater than 0.
  velaLogCloudCollectionExpirationIntervalOverride,
};

}  // namespace pairwell

template <>
inline constexpr platform::RawValues<pairwell::Defaults, 3> platform::rawValues<pairwell::Defaults> = {
    {{pairwell::Defaults::velaLogCloudCollectionEnabled, "VelaLogCloudCollectionEnabled"},
     {pairwell::Defaults::velaLogCloudCollectionEnabledExpiration, "VelaLogCloudCollectionEnabledExpiration"},
     {pairwell::Defaults::velaLogCloudCollectionExpirationIntervalOverride,
      "VelaLogCloudCollectionExpirationIntervalOverride"}}};
