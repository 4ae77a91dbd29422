#include "pairwelld/settings/CloudStoreHandle.hpp"

#include "platform/Platform.hpp"

namespace pairwell {
namespace {

const platform::SlotKey cloudStoreKey;
constexpr int cloudStoreTypeCode = 2;

}  // namespace

std::shared_ptr<platform::CloudStore> cloudStoreHandle() {
  return platform::current().slot<std::shared_ptr<platform::CloudStore>>(cloudStoreKey, [] {
    return platform::current().makeCloudStore("com.kestrel.bluetooth.cloud.settings", cloudStoreTypeCode);
  });
}

}  // namespace pairwell
