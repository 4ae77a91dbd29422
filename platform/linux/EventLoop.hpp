// The loop of a thread: descriptors, signals, wall-clock timers, and work handed over by other threads.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/Value.hpp"
#include "platform/WorkQueue.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

struct sd_event;
struct sd_event_source;

namespace platform::linux_ {

// One registration of an EventLoop; ends with its owner. Touched on the loop's thread only.
class EventSource {
 public:
  EventSource();
  EventSource(EventSource&&) noexcept;
  EventSource& operator=(EventSource&&) noexcept;
  ~EventSource();
  explicit operator bool() const { return state != nullptr; }

 private:
  friend class EventLoop;
  struct State;
  explicit EventSource(std::unique_ptr<State> state);
  std::unique_ptr<State> state;
};

// Registrations, and everything that they call, belong to the thread that runs the loop (before run(): to the
// thread that will). A failure to register, which only exhaustion can cause, stops the process. When nothing
// happens, nothing wakes.
class EventLoop : public WorkQueue {
 public:
  EventLoop();
  ~EventLoop() override;
  EventLoop(const EventLoop&) = delete;
  EventLoop& operator=(const EventLoop&) = delete;

  // Returns after stop(); work handed over before that has run.
  void run();
  // Any thread.
  void stop();
  // Any thread. Work runs in order.
  void async(Work work) override;

  // `events` are epoll's; `handler` gets those that are ready.
  [[nodiscard]] EventSource watchDescriptor(int descriptor, std::uint32_t events,
                                            std::function<void(std::uint32_t)> handler);
  // The signal must be blocked in every thread.
  [[nodiscard]] EventSource watchSignal(int signal, std::function<void()> handler);
  // Wall-clock, following the clock when it is set; accurate to a millisecond; once.
  [[nodiscard]] EventSource callAt(Time time, std::function<void()> handler);
  // Monotonic; once.
  [[nodiscard]] EventSource callAfter(std::chrono::microseconds delay, std::function<void()> handler);

 private:
  void runHandedOver();
  EventSource addTimer(int clock, std::uint64_t microseconds, std::function<void()> handler);

  sd_event* event = nullptr;
  UniqueDescriptor wakeUp;
  EventSource wakeUpSource;
  std::mutex mutex;
  std::vector<Work> handedOver;  // guarded by `mutex`
};

}  // namespace platform::linux_
