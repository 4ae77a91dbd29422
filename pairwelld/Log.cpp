#include "pairwelld/Log.hpp"

#include <string>

#include "platform/Platform.hpp"

namespace pairwell {
namespace {

const platform::SlotKey daemonKey;
const platform::SlotKey debugManagerKey;
const platform::SlotKey kvsKey;
const platform::SlotKey notificationKey;
const platform::SlotKey conduitKey;

const platform::Logger& logger(const platform::SlotKey& key, std::string_view category) {
  return platform::current().slot<platform::Logger>(key, [category] {
    return platform::Logger({std::string(LogConstants::subsystem), std::string(category), true});
  });
}

}  // namespace

const platform::Logger& Log::daemon() { return logger(daemonKey, "daemon"); }
const platform::Logger& Log::debugManager() { return logger(debugManagerKey, "debugManager"); }
const platform::Logger& Log::kvs() { return logger(kvsKey, "kvs"); }
const platform::Logger& Log::notification() { return logger(notificationKey, "notification"); }
const platform::Logger& Log::conduit() { return logger(conduitKey, "conduit"); }

}  // namespace pairwell
