#include "platform/linux/BusClient.hpp"

#include <sys/socket.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "platform/linux/BusValue.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

namespace platform::linux_ {
namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::microseconds;

// As callers tell them apart.
std::error_code failure(int error) {
  switch (error) {
    case EPERM:
    case EACCES:
      return Outcome::notPermitted;
    case ENOENT:
    case ECONNREFUSED:
    case ECONNRESET:
    case ENOTCONN:
    case EPIPE:
      return Outcome::notConnected;
    case ETIMEDOUT:
    case EAGAIN:
      return Outcome::timedOut;
    default:
      return {error, std::system_category()};
  }
}

std::uint64_t remaining(Clock::time_point deadline) {
  const auto left = std::chrono::duration_cast<microseconds>(deadline - Clock::now()).count();
  return left > 0 ? static_cast<std::uint64_t>(left) : 0;
}

Result<UniqueDescriptor> connectTo(const std::string& path, std::chrono::milliseconds timeout) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) return std::make_error_code(std::errc::filename_too_long);
  path.copy(address.sun_path, path.size());
  UniqueDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!socket) return failure(errno);
  // Bounds the wait where the queue of a service that does not accept is full.
  const timeval limit{timeout.count() / 1000, timeout.count() % 1000 * 1000};
  ::setsockopt(socket.get(), SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof limit);
  if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) < 0) {
    // The file system's word, no service's.
    if (errno == EACCES || errno == EPERM) return std::error_code(errno, std::system_category());
    return failure(errno);
  }
  return socket;
}

// Runs the library until `done` answers true, a message comes, or the time is up.
template <class Done>
Result<void> processUntil(sd_bus* bus, Clock::time_point deadline, Done done) {
  for (;;) {
    if (done()) return {};
    int result = sd_bus_process(bus, nullptr);
    if (result == 0) {
      const std::uint64_t time = remaining(deadline);
      if (time == 0) return Outcome::timedOut;
      result = sd_bus_wait(bus, time);
    }
    if (result < 0 && result != -EINTR) return failure(-result);
  }
}

}  // namespace

Result<std::unique_ptr<BusClient>> BusClient::connect(const std::string& path,
                                                      std::chrono::milliseconds timeout) {
  const auto deadline = Clock::now() + timeout;
  auto socket = connectTo(path, timeout);
  if (!socket) return socket.error();
  sd_bus* bus = nullptr;
  int result = sd_bus_new(&bus);
  if (result >= 0) result = sd_bus_set_fd(bus, socket->get(), socket->get());
  if (result < 0) {
    sd_bus_unref(bus);
    return failure(-result);
  }
  socket->release();  // the library closes it
  std::unique_ptr<BusClient> client(new BusClient(bus));
  result = sd_bus_start(bus);
  if (result < 0) return failure(-result);
  const auto ready = processUntil(bus, deadline, [&] { return sd_bus_is_ready(bus) > 0; });
  if (!ready) return ready.error();
  return client;
}

BusClient::BusClient(sd_bus* bus_) : bus(bus_) {}

// Nothing is left to flush after an answer; without one, a flush would wait 90 s for a service that hangs.
BusClient::~BusClient() { sd_bus_close_unref(bus); }

Result<BusReply> BusClient::call(const BusInterface& interface, const std::string& operation,
                                 const List& arguments, std::chrono::milliseconds timeout) {
  const BusOperation* description = nullptr;
  for (const BusOperation& candidate : interface.operations) {
    if (candidate.name == operation) description = &candidate;
  }
  if (!description) return std::make_error_code(std::errc::invalid_argument);
  sd_bus_message* request = nullptr;
  int result = sd_bus_message_new_method_call(bus, &request, nullptr, interface.path.c_str(),
                                              interface.name.c_str(), operation.c_str());
  if (result < 0) return failure(-result);
  const std::unique_ptr<sd_bus_message, sd_bus_message* (*)(sd_bus_message*)> ownedRequest(
      request, sd_bus_message_unref);
  if (const auto appended = appendValues(request, description->arguments, arguments); !appended)
    return appended.error();

  sd_bus_error error{};
  sd_bus_message* reply = nullptr;
  result =
      sd_bus_call(bus, request, static_cast<std::uint64_t>(microseconds(timeout).count()), &error, &reply);
  if (result < 0) {
    // The library describes its own failures in `error`, too.
    const std::error_code code = failure(-result);
    const bool own = code == Outcome::notConnected || code == Outcome::timedOut;
    BusError answered{error.name ? error.name : "", error.message ? error.message : ""};
    const bool described = sd_bus_error_is_set(&error) > 0 && !own;
    sd_bus_error_free(&error);
    if (!described) return code;
    return BusReply(std::move(answered));
  }
  auto values = readValues(reply, description->results);
  sd_bus_message_unref(reply);
  if (!values) return values.error();
  return BusReply(std::move(*values));
}

Result<std::optional<BusClient::Signal>> BusClient::nextSignal(
    std::optional<std::chrono::milliseconds> timeout) {
  const auto deadline = timeout ? Clock::now() + *timeout : Clock::time_point::max();
  for (;;) {
    sd_bus_message* message = nullptr;
    int result = sd_bus_process(bus, &message);
    const std::unique_ptr<sd_bus_message, sd_bus_message* (*)(sd_bus_message*)> owned(message,
                                                                                      sd_bus_message_unref);
    if (message && sd_bus_message_is_signal(message, nullptr, nullptr) > 0 &&
        std::strcmp(sd_bus_message_get_interface(message), "org.freedesktop.DBus.Local") != 0) {
      auto arguments = readValues(message, sd_bus_message_get_signature(message, 1));
      if (!arguments) return arguments.error();
      return std::optional<Signal>(Signal{sd_bus_message_get_member(message), std::move(*arguments)});
    }
    if (result == 0) {
      const std::uint64_t time = timeout ? remaining(deadline) : UINT64_MAX;
      if (time == 0) return std::optional<Signal>();
      result = sd_bus_wait(bus, time);
    }
    if (result < 0 && result != -EINTR) return failure(-result);
  }
}

}  // namespace platform::linux_
