#include "pairwelld/settings/CloudStoreHandle.hpp"

#include "pairwelld/Names.hpp"
#include "platform/Platform.hpp"

namespace pairwell {
namespace {

const platform::SlotKey cloudStoreKey;
constexpr int cloudStoreTypeCode = 2;

}  // namespace

std::shared_ptr<platform::CloudStore> cloudStoreHandle() {
  return platform::current().slot<std::shared_ptr<platform::CloudStore>>(cloudStoreKey, [] {
    return platform::current().makeCloudStore(names::cloudStore, cloudStoreTypeCode);
  });
}

}  // namespace pairwell
