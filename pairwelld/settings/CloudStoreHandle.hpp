// The process-wide cloud store of the settings.
#pragma once

#include <memory>
#include <string_view>

#include "platform/Stores.hpp"

namespace pairwell {

// Posted in the process after each of its own cloud writes.
inline constexpr std::string_view cloudStoreChangedNotification = "com.kestrel.pairwell.cloud.storeChanged";

// One object for manager and observer, who matches notifications against it. Made on first use. Any thread.
std::shared_ptr<platform::CloudStore> cloudStoreHandle();

}  // namespace pairwell
