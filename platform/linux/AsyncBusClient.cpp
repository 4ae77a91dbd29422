#include "platform/linux/AsyncBusClient.hpp"

#include <systemd/sd-bus.h>

#include <cstdint>
#include <cstring>
#include <string>
#include <utility>

#include "platform/LogSink.hpp"
#include "platform/linux/BusValue.hpp"

namespace platform::linux_ {
namespace {

void logFault(const char* what, int error) { hearthLog("link").error("%s: %s", what, std::strerror(-error)); }

struct PendingReply {
  BusCompletion completion;
  std::string results;

  // Called by the library, also with an error of its own making when the connection ends.
  static int arrived(sd_bus_message* message, void* data, sd_bus_error*) {
    auto* pending = static_cast<PendingReply*>(data);
    if (const sd_bus_error* error = sd_bus_message_get_error(message)) {
      pending->completion(BusError{error->name, error->message ? error->message : ""});
      return 0;
    }
    Result<List> values = readValues(message, pending->results);
    if (values) {
      pending->completion(std::move(*values));
    } else {
      pending->completion(BusError{SD_BUS_ERROR_INCONSISTENT_MESSAGE, values.error().message()});
    }
    return 0;
  }
  static void drop(void* data) { delete static_cast<PendingReply*>(data); }
};

}  // namespace

AsyncBusClient::AsyncBusClient(EventLoop& loop_, UniqueDescriptor socket, const BusInterface& interface_,
                               SignalHandler signal_, std::function<void()> lost_)
    : loop(loop_), interface(interface_), signal(std::move(signal_)), lost(std::move(lost_)) {
  int result = sd_bus_new(&bus);
  if (result >= 0) result = sd_bus_set_fd(bus, socket.get(), socket.get());
  if (result >= 0) socket.release();  // the bus closes it
  if (result >= 0) {
    result = sd_bus_add_filter(
        bus, nullptr,
        [](sd_bus_message* message, void* self, sd_bus_error*) {
          static_cast<AsyncBusClient*>(self)->receive(message);
          return 0;
        },
        this);
  }
  if (result >= 0) result = sd_bus_start(bus);
  if (result < 0) {
    logFault("cannot open", result);
    end();
  }
  rearm();
}

AsyncBusClient::~AsyncBusClient() {
  source = EventSource();
  sd_bus_close_unref(bus);
}

void AsyncBusClient::call(std::size_t operation, const List& arguments, BusCompletion reply) {
  if (ended) return;
  const BusOperation& description = interface.operations.at(operation);
  sd_bus_message* message = nullptr;
  int result = sd_bus_message_new_method_call(bus, &message, nullptr, interface.path.c_str(),
                                              interface.name.c_str(), description.name.c_str());
  if (result >= 0) {
    if (const auto appended = appendValues(message, description.arguments, arguments); !appended) {
      hearthLog("link").error("%s: %s", description.name, appended.error().message());
      sd_bus_message_unref(message);
      return reply(BusError{SD_BUS_ERROR_INVALID_ARGS, appended.error().message()});
    }
    sd_bus_slot* slot = nullptr;
    auto* pending = new PendingReply{std::move(reply), description.results};
    // No timeout: the service manager is on this machine, and its end ends the connection.
    result = sd_bus_call_async(bus, &slot, message, PendingReply::arrived, pending, UINT64_MAX);
    if (result >= 0) {
      sd_bus_slot_set_destroy_callback(slot, PendingReply::drop);
      sd_bus_slot_set_floating(slot, 1);
      sd_bus_slot_unref(slot);
    } else {
      PendingReply::drop(pending);
    }
  }
  sd_bus_message_unref(message);
  if (result < 0) logFault(description.name.c_str(), result);
  rearm();
}

void AsyncBusClient::receive(sd_bus_message* message) {
  for (std::size_t index = 0; index < interface.signals.size(); ++index) {
    const BusSignal& description = interface.signals[index];
    if (sd_bus_message_is_signal(message, interface.name.c_str(), description.name.c_str()) <= 0) continue;
    if (Result<List> arguments = readValues(message, description.arguments)) {
      signal(index, std::move(*arguments));
    } else {
      hearthLog("link").error("%s: %s", description.name, arguments.error().message());
    }
    return;
  }
}

void AsyncBusClient::pump() {
  int result;
  do {
    result = sd_bus_process(bus, nullptr);
  } while (result > 0);
  if (result < 0) return end();
  rearm();
}

void AsyncBusClient::rearm() {
  if (ended) return;
  const int events = sd_bus_get_events(bus);
  if (events < 0) return;  // the next pump() meets the end
  if (source && events == watched) return;
  source = EventSource();  // a loop takes a descriptor only once
  watched = events;
  source = loop.watchDescriptor(sd_bus_get_fd(bus), static_cast<std::uint32_t>(events),
                                [this](std::uint32_t) { pump(); });
}

void AsyncBusClient::end() {
  if (std::exchange(ended, true)) return;
  source = EventSource();
  lost();
}

}  // namespace platform::linux_
