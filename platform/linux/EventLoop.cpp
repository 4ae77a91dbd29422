#include "platform/linux/EventLoop.hpp"

#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <systemd/sd-event.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstring>
#include <exception>
#include <string>
#include <utility>

#include "platform/Platform.hpp"

namespace platform::linux_ {
namespace {

void require(int result, const char* what) {
  if (result < 0) platform::stop(std::string("event loop: ") + what + ": " + std::strerror(-result));
}

// Timers are armed with this accuracy: sd-event's default of 250 ms is too coarse for alarms.
constexpr std::uint64_t accuracyMicroseconds = 1000;

}  // namespace

struct EventSource::State {
  std::function<void(std::uint32_t)> handler;
  sd_event_source* source = nullptr;

  ~State() { sd_event_source_disable_unref(source); }

  // A handler may end its own registration, so it is copied for its call.
  static int call(void* userData, std::uint32_t events) {
    const auto handler = static_cast<State*>(userData)->handler;
    handler(events);
    return 0;
  }
};

EventSource::EventSource() = default;
EventSource::EventSource(std::unique_ptr<State> state_) : state(std::move(state_)) {}
EventSource::EventSource(EventSource&&) noexcept = default;
EventSource& EventSource::operator=(EventSource&&) noexcept = default;
EventSource::~EventSource() = default;

EventLoop::EventLoop() : wakeUp(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
  require(sd_event_new(&event), "cannot be made");
  if (!wakeUp) require(-errno, "eventfd");
  // The first timer of a clock opens its descriptor, which stays: here, where a failure is that of the start.
  for (const int clock : {CLOCK_REALTIME, CLOCK_MONOTONIC}) addTimer(clock, UINT64_MAX, [] {});
  wakeUpSource = watchDescriptor(wakeUp.get(), EPOLLIN, [this](std::uint32_t) { runHandedOver(); });
}

EventLoop::~EventLoop() {
  wakeUpSource = EventSource();
  sd_event_unref(event);
}

void EventLoop::run() { require(sd_event_loop(event), "run"); }

void EventLoop::stop() {
  async([this] { sd_event_exit(event, 0); });
}

void EventLoop::async(Work work) {
  bool first;
  {
    std::lock_guard lock(mutex);
    first = handedOver.empty();
    handedOver.push_back(std::move(work));
  }
  // Under way already otherwise: the loop takes everything that is there.
  if (first) eventfd_write(wakeUp.get(), 1);
}

void EventLoop::runHandedOver() {
  eventfd_t ignored;
  eventfd_read(wakeUp.get(), &ignored);
  std::vector<Work> batch;
  {
    std::lock_guard lock(mutex);
    batch.swap(handedOver);
  }
  for (Work& work : batch) {
    try {
      work();
    } catch (const std::exception& error) {
      platform::stop(error.what());
    }
    work = nullptr;  // a closure dies before the next one runs
  }
}

EventSource EventLoop::watchDescriptor(int descriptor, std::uint32_t events,
                                       std::function<void(std::uint32_t)> handler) {
  auto state = std::make_unique<EventSource::State>();
  state->handler = std::move(handler);
  require(sd_event_add_io(
              event, &state->source, descriptor, events,
              [](sd_event_source*, int, std::uint32_t ready, void* data) {
                return EventSource::State::call(data, ready);
              },
              state.get()),
          "watch a descriptor");
  return EventSource(std::move(state));
}

EventSource EventLoop::watchSignal(int signal, std::function<void()> handler) {
  auto state = std::make_unique<EventSource::State>();
  state->handler = [handler = std::move(handler)](std::uint32_t) { handler(); };
  require(sd_event_add_signal(
              event, &state->source, signal,
              [](sd_event_source*, const signalfd_siginfo*, void* data) {
                return EventSource::State::call(data, 0);
              },
              state.get()),
          "watch a signal");
  return EventSource(std::move(state));
}

EventSource EventLoop::addTimer(int clock, std::uint64_t microseconds, std::function<void()> handler) {
  auto state = std::make_unique<EventSource::State>();
  state->handler = [handler = std::move(handler)](std::uint32_t) { handler(); };
  require(sd_event_add_time(
              event, &state->source, clock, microseconds, accuracyMicroseconds,
              [](sd_event_source*, std::uint64_t, void* data) { return EventSource::State::call(data, 0); },
              state.get()),
          "add a timer");
  return EventSource(std::move(state));
}

EventSource EventLoop::callAt(Time time, std::function<void()> handler) {
  // 292 years, what a timer accepts; times before 1970 have passed.
  const double microseconds = std::clamp(time.count() * 1e6, 0.0, 9.2e15);
  return addTimer(CLOCK_REALTIME, static_cast<std::uint64_t>(std::ceil(microseconds)), std::move(handler));
}

EventSource EventLoop::callAfter(std::chrono::microseconds delay, std::function<void()> handler) {
  timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  const auto start =
      static_cast<std::uint64_t>(now.tv_sec) * 1'000'000 + static_cast<std::uint64_t>(now.tv_nsec) / 1000;
  return addTimer(CLOCK_MONOTONIC,
                  start + static_cast<std::uint64_t>(std::max<std::int64_t>(delay.count(), 0)),
                  std::move(handler));
}

}  // namespace platform::linux_
