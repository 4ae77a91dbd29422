#include "platform/linux/DeadlineTimer.hpp"

#include <sys/timerfd.h>

namespace platform::linux_ {

DeadlineTimer::DeadlineTimer() : timer(::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK)) {}

void DeadlineTimer::set(std::uint64_t number, std::optional<TimePoint> deadline) {
  const auto found = byNumber.find(number);
  if (found != byNumber.end()) {
    if (deadline == found->second) return;
    byTime.erase({found->second, number});
    byNumber.erase(found);
  }
  if (deadline) {
    byNumber.emplace(number, *deadline);
    byTime.emplace(*deadline, number);
  }
  arm();
}

std::vector<std::uint64_t> DeadlineTimer::takePassed() {
  std::uint64_t ignored;
  [[maybe_unused]] const ssize_t count = ::read(timer.get(), &ignored, sizeof ignored);
  armed.reset();
  std::vector<std::uint64_t> passed;
  const auto now = std::chrono::steady_clock::now();
  while (!byTime.empty() && byTime.begin()->first <= now) {
    passed.push_back(byTime.begin()->second);
    byNumber.erase(byTime.begin()->second);
    byTime.erase(byTime.begin());
  }
  arm();
  return passed;
}

void DeadlineTimer::arm() {
  const auto next = byTime.empty() ? std::nullopt : std::optional(byTime.begin()->first);
  if (next == armed) return;
  armed = next;
  itimerspec spec{};
  if (next) {
    const auto since = std::chrono::duration_cast<std::chrono::nanoseconds>(next->time_since_epoch()).count();
    spec.it_value = {since / 1'000'000'000, since % 1'000'000'000};
  }
  ::timerfd_settime(timer.get(), TFD_TIMER_ABSTIME, &spec, nullptr);
}

}  // namespace platform::linux_
