// The socket that clients connect to, in a server's epoll set.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <optional>

#include "platform/linux/UniqueDescriptor.hpp"

namespace platform::linux_ {

// The server's thread. At the limit of descriptors it rests: a listening socket that stays readable would
// spin, and what is open already needs some for its answers.
class BusAcceptor {
 public:
  using TimePoint = std::chrono::steady_clock::time_point;

  // `tag` stands for it in the events of `epoll`.
  BusAcceptor(int epoll_, std::uint64_t tag_, std::chrono::milliseconds rest_)
      : epoll(epoll_), tag(tag_), rest(rest_) {}

  void listen(UniqueDescriptor socket);
  void stop();
  // Offers some of those who wait, in turns, so that those who are connected already have theirs. `offer`
  // returns how many connections there are with it, and may call stop().
  using Offer = std::function<std::size_t(UniqueDescriptor client)>;
  void acceptSome(std::size_t connections, const Offer& offer);
  // A client has gone, or the rest is over.
  void resume();
  // When it is over.
  std::optional<TimePoint> deadline() const { return resting; }
  // How many connections the process's descriptors are enough for.
  std::size_t room() const;

 private:
  void takeRest();
  void watch(int operation, std::uint32_t events);

  const int epoll;
  const std::uint64_t tag;
  const std::chrono::milliseconds rest;
  UniqueDescriptor listener;
  std::size_t ownDescriptors = 0;  // of the process, without clients
  std::optional<TimePoint> resting;
  bool told = false;  // that the limit is reached
};

}  // namespace platform::linux_
