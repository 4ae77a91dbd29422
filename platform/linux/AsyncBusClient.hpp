// A client of a BusServer that never waits, on the thread of an event loop.
#pragma once

#include <cstddef>
#include <functional>
#include <memory>

#include "platform/linux/BusServer.hpp"
#include "platform/linux/EventLoop.hpp"

struct sd_bus;
struct sd_bus_message;

namespace platform::linux_ {

// One connection. Everything here belongs to the loop's thread.
class AsyncBusClient {
 public:
  // `signal` gets an index into BusInterface::signals. `lost` is called once, when the connection has ended;
  // neither destroys the client.
  using SignalHandler = std::function<void(std::size_t signal, List arguments)>;
  AsyncBusClient(EventLoop& loop, UniqueDescriptor socket, const BusInterface& interface,
                 SignalHandler signal, std::function<void()> lost);
  ~AsyncBusClient();
  AsyncBusClient(const AsyncBusClient&) = delete;
  AsyncBusClient& operator=(const AsyncBusClient&) = delete;

  // Calls are sent, and answered, in order. `reply` may stay uncalled when the connection ends first.
  void call(std::size_t operation, const List& arguments, BusCompletion reply);

 private:
  void receive(sd_bus_message* message);
  void pump();
  void rearm();
  void end();

  EventLoop& loop;
  const BusInterface& interface;
  const SignalHandler signal;
  const std::function<void()> lost;
  sd_bus* bus = nullptr;
  EventSource source;
  int watched = 0;
  bool ended = false;
};

}  // namespace platform::linux_
