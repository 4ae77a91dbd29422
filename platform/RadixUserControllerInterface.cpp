#include "platform/RadixUserControllerInterface.hpp"

#include <utility>

namespace platform {
namespace {

using Reply = std::function<void(OperationReply)>;

// What a completion with one result, or with none, makes of its arguments.
template <class Convert>
auto answer(Reply reply, Convert convert) {
  return [reply = std::move(reply), convert](const auto& result, OptionalError error) {
    error ? reply(*error) : reply(List{convert(result)});
  };
}

auto answerWithNothing(Reply reply) {
  return [reply = std::move(reply)](OptionalError error) { error ? reply(*error) : reply(List{}); };
}

List optionalName(const std::optional<std::string>& name) { return name ? List{*name} : List{}; }

std::shared_ptr<const InterfaceDescription> makeDescription() {
  return std::make_shared<const InterfaceDescription>(InterfaceDescription{
      "com.kestrel.pairwell.RadixUserController",
      {{"GetDistributedLoggingStatus", "", "u",
        [](RadixUserControllerInterface& object, const List&, Reply reply) {
          object.getDistributedLoggingStatus(
              answer(std::move(reply), [](std::uint32_t status) { return Value(std::int64_t{status}); }));
        }},
       {"SetDistributedLoggingStatus", "u", "",
        [](RadixUserControllerInterface& object, const List& arguments, Reply reply) {
          object.setDistributedLoggingStatus(static_cast<std::uint32_t>(*arguments.at(0).as<std::int64_t>()),
                                             answerWithNothing(std::move(reply)));
        }},
       {"KestrelAudioAccessoryLimitedLogging", "", "b",
        [](RadixUserControllerInterface& object, const List&, Reply reply) {
          object.kestrelAudioAccessoryLimitedLogging(
              answer(std::move(reply), [](bool enabled) { return Value(enabled); }));
        }},
       {"SetKestrelAudioAccessoryLimitedLogging", "b", "",
        [](RadixUserControllerInterface& object, const List& arguments, Reply reply) {
          object.setKestrelAudioAccessoryLimitedLogging(*arguments.at(0).as<bool>(),
                                                        answerWithNothing(std::move(reply)));
        }},
       // The format has no absent text: an array of none or one stands for it.
       {"GetCurrentUserGivenName", "", "as",
        [](RadixUserControllerInterface& object, const List&, Reply reply) {
          object.getCurrentUserGivenName(answer(std::move(reply), [](const std::optional<std::string>& name) {
            return Value(optionalName(name));
          }));
        }}}});
}

}  // namespace

std::shared_ptr<const InterfaceDescription> RadixUserControllerConduitInterface() {
  static const std::shared_ptr<const InterfaceDescription> description = makeDescription();
  return description;
}

}  // namespace platform
