// The smallest service that the library makes, a peer of ours: it answers Echo with one text.
// Usage: pairwell_echo ADDRESS   (of a bus, under the name x.echo)
//        pairwell_echo --listen SOCKET   (to clients that connect to it themselves)
#include <sys/socket.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <set>
#include <string>

namespace {

int insist(int result, const char* what) {
  if (result >= 0) return result;
  std::fprintf(stderr, "pairwell_echo: %s: %s\n", what, std::strerror(result == -1 ? errno : -result));
  std::exit(1);
}

int echo(sd_bus_message* call, void*, sd_bus_error*) { return sd_bus_reply_method_return(call, "s", "Pat"); }

const sd_bus_vtable operations[] = {SD_BUS_VTABLE_START(0),
                                    SD_BUS_METHOD("Echo", "", "s", echo, SD_BUS_VTABLE_UNPRIVILEGED),
                                    SD_BUS_VTABLE_END};

int serve(sd_bus* bus, sd_event* loop) {
  insist(sd_bus_add_object_vtable(bus, nullptr, "/x", "x.Echo", operations, nullptr), "object");
  const int started = sd_bus_start(bus);
  return started < 0 ? started : sd_bus_attach_event(bus, loop, SD_EVENT_PRIORITY_NORMAL);
}

int ended(sd_bus_message* message, void*, sd_bus_error*) {
  sd_bus* bus = sd_bus_message_get_bus(message);
  sd_bus_detach_event(bus);
  sd_bus_close_unref(bus);
  return 0;
}

int accept(sd_event_source* source, int listener, std::uint32_t, void*) {
  const int socket = ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
  if (socket < 0) return 0;
  sd_bus* bus = nullptr;
  sd_id128_t identifier;
  insist(sd_id128_randomize(&identifier), "identifier");
  insist(sd_bus_new(&bus), "bus");
  insist(sd_bus_set_fd(bus, socket, socket), "descriptor");
  insist(sd_bus_set_server(bus, 1, identifier), "server");
  insist(sd_bus_match_signal_async(bus, nullptr, "org.freedesktop.DBus.Local", nullptr,
                                   "org.freedesktop.DBus.Local", "Disconnected", ended, nullptr, nullptr),
         "match");
  if (serve(bus, sd_event_source_get_event(source)) < 0) sd_bus_close_unref(bus);  // it has gone already
  return 0;
}

void listenAt(const char* path, sd_event* loop) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::string(path).copy(address.sun_path, sizeof address.sun_path - 1);
  const int listener = insist(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0), "socket");
  insist(::bind(listener, reinterpret_cast<const sockaddr*>(&address), sizeof address), path);
  insist(::listen(listener, 1024), path);
  insist(sd_event_add_io(loop, nullptr, listener, EPOLLIN, accept, nullptr), "watch");
}

void joinBus(const char* address, sd_event* loop) {
  sd_bus* bus = nullptr;
  insist(sd_bus_new(&bus), "bus");
  insist(sd_bus_set_address(bus, address), address);
  insist(sd_bus_set_bus_client(bus, 1), "client");
  insist(serve(bus, loop), "start");
  insist(sd_bus_request_name(bus, "x.echo", 0), "name");
}

}  // namespace

int main(int count, char** arguments) {
  sd_event* loop = nullptr;
  insist(sd_event_new(&loop), "loop");
  if (count == 2) {
    joinBus(arguments[1], loop);
  } else if (count == 3 && std::string(arguments[1]) == "--listen") {
    listenAt(arguments[2], loop);
  } else {
    std::fprintf(stderr, "usage: pairwell_echo ADDRESS | --listen SOCKET\n");
    return 2;
  }
  insist(sd_event_loop(loop), "loop");
}
