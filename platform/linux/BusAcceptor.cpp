#include "platform/linux/BusAcceptor.hpp"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/resource.h>
#include <sys/socket.h>

#include <cerrno>
#include <utility>

#include "platform/LogSink.hpp"
#include "platform/Platform.hpp"
#include "platform/linux/BusLimits.hpp"

namespace platform::linux_ {

void BusAcceptor::listen(UniqueDescriptor socket) {
  listener = std::move(socket);
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

void BusAcceptor::acceptSome(const std::function<void(UniqueDescriptor)>& offer) {
  for (int turn = 0; turn < 16 && listener; ++turn) {
    if (!hasSpareDescriptors()) return takeRest();
    UniqueDescriptor socket(::accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
    if (socket) {
      told = false;
      offer(std::move(socket));
    } else if (errno == EAGAIN) {
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

// The kernel gives out the lowest free number.
bool BusAcceptor::hasSpareDescriptors() const {
  const UniqueDescriptor lowest(::fcntl(epoll, F_DUPFD_CLOEXEC, 0));
  rlimit limit{};
  if (!lowest || ::getrlimit(RLIMIT_NOFILE, &limit) != 0) return false;
  return static_cast<rlim_t>(lowest.get()) + limits::spareDescriptors < limit.rlim_cur;
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
