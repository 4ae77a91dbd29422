// The threads behind the global queues, the worker pool and the serial queues.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <deque>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/WorkQueue.hpp"

namespace platform::linux_ {

// Threads start when first needed, up to `threads`. At most one wake-up is under way, and the woken worker
// wakes the next before it runs its job: workers that are all woken for one job and fight over it cost more
// than the job.
class ThreadPool : public WorkQueue {
 public:
  explicit ThreadPool(std::size_t threads);
  // Runs what is queued, then ends the threads. No async() may be under way, even if its work has run.
  ~ThreadPool() override;

  void async(Work work) override;

  // Whether nothing is queued and nothing runs, now or before `deadline`.
  bool waitUntilIdle(std::chrono::steady_clock::time_point deadline);

 private:
  // With `mutex` held: starts a thread for what is queued, if need be; or whether one that waits has to be
  // notified.
  bool startsOrWakes();
  void work();

  const std::size_t maximum;
  std::mutex mutex;  // guards everything below
  std::condition_variable wake;
  std::condition_variable idleChanged;
  std::deque<Work> queue;
  std::vector<std::thread> threads;
  std::size_t idle = 0;
  bool waking = false;
  bool stopping = false;
};

}  // namespace platform::linux_
