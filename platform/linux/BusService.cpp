#include "platform/linux/BusService.hpp"

#include <systemd/sd-bus.h>

#include <cstdint>
#include <utility>

#include "platform/linux/BusSession.hpp"

namespace platform::linux_ {
namespace {

// What stock clients ask of a bus before their first call; they are content with these answers.
int answerHello(sd_bus_message* message, void* self, sd_bus_error*) {
  const std::string name = ":1." + std::to_string(static_cast<BusSession*>(self)->number);
  return sd_bus_reply_method_return(message, "s", name.c_str());
}
int answerNothing(sd_bus_message* message, void*, sd_bus_error*) {
  return sd_bus_reply_method_return(message, "");
}
int answerOwner(sd_bus_message* message, void*, sd_bus_error*) {
  return sd_bus_reply_method_return(message, "s", ":1.0");
}
int answerRunning(sd_bus_message* message, void*, sd_bus_error*) {
  constexpr std::uint32_t alreadyRunning = 2;
  return sd_bus_reply_method_return(message, "u", alreadyRunning);
}
const sd_bus_vtable busTable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("Hello", "", "s", answerHello, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("AddMatch", "s", "", answerNothing, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("RemoveMatch", "s", "", answerNothing, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("GetNameOwner", "s", "s", answerOwner, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("StartServiceByName", "su", "u", answerRunning, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

std::vector<sd_bus_vtable> makeTable(const BusInterface& interface) {
  std::vector<sd_bus_vtable> table{SD_BUS_VTABLE_START(0)};
  for (const BusOperation& operation : interface.operations) {
    table.push_back(SD_BUS_METHOD("", "", "", nullptr, SD_BUS_VTABLE_UNPRIVILEGED));
    auto& method = table.back().x.method;
    method.member = operation.name.c_str();
    method.signature = operation.arguments.c_str();
    method.result = operation.results.c_str();
    method.handler = [](sd_bus_message* message, void* session, sd_bus_error*) {
      return static_cast<BusSession*>(session)->call(message);
    };
  }
  for (const BusSignal& signal : interface.signals) {
    table.push_back(SD_BUS_SIGNAL("", "", 0));
    table.back().x.signal.member = signal.name.c_str();
    table.back().x.signal.signature = signal.arguments.c_str();
  }
  table.push_back(SD_BUS_VTABLE_END);
  return table;
}

std::string randomIdentifier() {
  sd_id128_t identifier{};
  sd_id128_randomize(&identifier);
  char text[SD_ID128_STRING_MAX];
  return sd_id128_to_string(identifier, text);
}

}  // namespace

BusService::BusService(BusInterface interface_, limits::Patience patience_)
    : interface(std::move(interface_)),
      patience(patience_),
      table(makeTable(interface)),
      identifier(randomIdentifier()) {}

BusService::~BusService() = default;

int BusService::open(BusSession& session, UniqueDescriptor in, UniqueDescriptor out, sd_bus*& bus) const {
  int result = sd_bus_new(&bus);
  if (result >= 0) result = sd_bus_set_fd(bus, in.get(), out.get());
  if (result < 0) return result;
  in.release();  // the library closes both
  out.release();
  sd_id128_t server{};
  result = sd_id128_from_string(identifier.c_str(), &server);
  if (result >= 0) result = sd_bus_set_server(bus, 1, server);
  if (result >= 0) result = sd_bus_set_anonymous(bus, 1);
  if (result >= 0) result = sd_bus_negotiate_fds(bus, 0);
  if (result >= 0) {
    const auto count = [](sd_bus_message*, void* counted, sd_bus_error*) {
      static_cast<BusSession*>(counted)->countMessage();
      return 0;
    };
    result = sd_bus_add_filter(bus, nullptr, count, &session);
  }
  if (result >= 0)
    result = sd_bus_add_object_vtable(bus, nullptr, interface.path.c_str(), interface.name.c_str(),
                                      table.data(), &session);
  if (result >= 0)
    result = sd_bus_add_object_vtable(bus, nullptr, "/org/freedesktop/DBus", "org.freedesktop.DBus", busTable,
                                      &session);
  if (result >= 0) result = sd_bus_start(bus);
  return result < 0 ? result : 1;
}

}  // namespace platform::linux_
