// What clients may ask of the daemon, and its description as the service publishes it.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <system_error>
#include <variant>
#include <vector>

#include "platform/Value.hpp"

namespace platform {

// No error is an absent one. Each completion is called exactly once, on any thread.
using OptionalError = std::optional<std::error_code>;

// Called on the thread that delivers the request, which must not be held up.
class RadixUserControllerInterface {
 public:
  virtual ~RadixUserControllerInterface() = default;
  virtual void getDistributedLoggingStatus(std::function<void(std::uint32_t, OptionalError)> completion) = 0;
  virtual void setDistributedLoggingStatus(std::uint32_t status,
                                           std::function<void(OptionalError)> completion) = 0;
  virtual void kestrelAudioAccessoryLimitedLogging(std::function<void(bool, OptionalError)> completion) = 0;
  virtual void setKestrelAudioAccessoryLimitedLogging(bool enabled,
                                                      std::function<void(OptionalError)> completion) = 0;
  virtual void getCurrentUserGivenName(
      std::function<void(std::optional<std::string>, OptionalError)> completion) = 0;
};

// Results of one operation, or the error in their place.
using OperationReply = std::variant<List, std::error_code>;

struct OperationDescription {
  std::string_view name;
  // Types in the D-Bus notation; booleans, integers and texts arrive as the property values of that type.
  std::string_view arguments;
  std::string_view results;
  void (*call)(RadixUserControllerInterface& object, const List& arguments,
               std::function<void(OperationReply)> completion);
};

struct InterfaceDescription {
  std::string_view name;
  std::vector<OperationDescription> operations;
};

// One object serves every use.
std::shared_ptr<const InterfaceDescription> RadixUserControllerConduitInterface();

}  // namespace platform
