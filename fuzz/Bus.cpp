// What a client writes to the socket of a service: from its first byte on or, where the first is even, behind
// a handshake. hearthd's interface is served, as its operations take all types that there are.
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <memory>
#include <string>

#include "fuzz/Target.hpp"
#include "platform/linux/BusServer.hpp"
#include "platform/linux/HearthInterface.hpp"

namespace linux_ = platform::linux_;

namespace {

struct Handler : linux_::BusHandler {
  void call(std::size_t operation, platform::List arguments, linux_::BusCompletion completion) override {
    fuzz::require(operation < linux_::hearthInterface().operations.size());
    static_cast<void>(platform::describe(platform::Value(std::move(arguments))));
    completion(linux_::BusError{std::string(linux_::failedError), "no"});
  }
  void closed() override {}
};

void serve(linux_::BusServer& server, int client) {
  pollfd ready{server.descriptor(), POLLIN, 0};
  while (::poll(&ready, 1, 0) > 0) {
    server.dispatch();
    char answers[4096];
    while (::recv(client, answers, sizeof answers, MSG_DONTWAIT) > 0) {
    }
  }
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  constexpr std::string_view handshake{"\0AUTH EXTERNAL\r\nDATA\r\nBEGIN\r\n", 29};
  if (size == 0) return 0;
  int ends[2];
  fuzz::require(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends) == 0);
  const linux_::UniqueDescriptor client(ends[0]);
  linux_::BusServer server(linux_::hearthInterface());
  linux_::PeerIdentity peer;
  peer.uid = ::geteuid();
  server.adopt(linux_::UniqueDescriptor(ends[1]), peer, std::make_shared<Handler>());
  std::string input(data[0] % 2 == 0 ? handshake : "");
  input += fuzz::textOf(data + 1, size - 1);
  for (std::string_view rest = input; !rest.empty();) {
    const ssize_t sent = ::send(client.get(), rest.data(), rest.size(), MSG_NOSIGNAL);
    if (sent > 0) rest.remove_prefix(static_cast<std::size_t>(sent));
    if (sent < 0 && errno != EAGAIN) break;  // the server has closed
    serve(server, client.get());
  }
  ::shutdown(client.get(), SHUT_WR);
  serve(server, client.get());
  return 0;
}
