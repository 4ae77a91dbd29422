#include "platform/linux/BusAcceptor.hpp"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/resource.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/ClientLimits.hpp"
#include "platform/LogSink.hpp"
#include "platform/Platform.hpp"

namespace platform::linux_ {

void BusAcceptor::listen(UniqueDescriptor socket) {
  listener = std::move(socket);
  // The kernel gives out the lowest free number.
  ownDescriptors =
      static_cast<std::size_t>(std::max(UniqueDescriptor(::fcntl(epoll, F_DUPFD_CLOEXEC, 0)).get(), 0));
  ::fcntl(listener.get(), F_SETFL, ::fcntl(listener.get(), F_GETFL) | O_NONBLOCK);
  watch(EPOLL_CTL_ADD, EPOLLIN);
}

void BusAcceptor::stop() {
  // The service manager holds the same socket: closing ours alone would leave it watched, and clients that
  // come later would wake the loop for ever.
  if (listener) watch(EPOLL_CTL_DEL, 0);
  listener.reset();
  resting.reset();
}

void BusAcceptor::acceptSome(std::size_t connections, const Offer& offer) {
  for (int turn = 0; turn < 16 && listener; ++turn) {
    if (connections >= room()) return takeRest();
    UniqueDescriptor socket(::accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
    if (socket) {
      connections = offer(std::move(socket));
    } else if (errno == EAGAIN) {
      told = false;
      return;
    } else if (errno != ECONNABORTED && errno != EINTR) {
      return takeRest();
    }
  }
}

void BusAcceptor::resume() {
  if (!resting) return;
  resting.reset();
  watch(EPOLL_CTL_MOD, EPOLLIN);
}

// Counted by connections: the lowest free number says nothing of how many there are above it, and who is in
// his handshake has not taken all of his yet.
std::size_t BusAcceptor::room() const {
  const rlim_t kept = ownDescriptors + limits::spareDescriptors;
  rlimit limit{};
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur < kept) return 0;
  return (limit.rlim_cur - kept) / limits::descriptorsPerConnection;
}

void BusAcceptor::takeRest() {
  if (!std::exchange(told, true)) hearthLog("bus").error("at the limit of descriptors: accepting rests");
  watch(EPOLL_CTL_MOD, 0);
  resting = std::chrono::steady_clock::now() + rest;
}

void BusAcceptor::watch(int operation, std::uint32_t events) {
  epoll_event event{};
  event.events = events;
  event.data.u64 = tag;
  if (::epoll_ctl(epoll, operation, listener.get(), &event) < 0)
    platform::stop("bus server: epoll: " + lastError().message());
}

}  // namespace platform::linux_
