#include "platform/linux/ThreadPool.hpp"

#include <exception>
#include <utility>

#include "platform/Platform.hpp"

namespace platform::linux_ {

ThreadPool::ThreadPool(std::size_t threads_) : maximum(threads_) {}

ThreadPool::~ThreadPool() {
  {
    std::lock_guard lock(mutex);
    stopping = true;
  }
  wake.notify_all();
  for (std::thread& thread : threads) thread.join();
}

void ThreadPool::async(Work item) {
  bool notifies;
  {
    std::lock_guard lock(mutex);
    queue.push_back(std::move(item));
    notifies = startsOrWakes();
  }
  // Not under the lock: the woken worker would wait for it at once, and have to be woken again.
  if (notifies) wake.notify_one();
}

bool ThreadPool::startsOrWakes() {
  if (waking || queue.empty()) return false;
  if (idle > 0) {
    waking = true;
    return true;
  }
  if (threads.size() < maximum && !stopping) {
    waking = true;
    threads.emplace_back([this] { work(); });
  }
  return false;
}

bool ThreadPool::waitUntilIdle(std::chrono::steady_clock::time_point deadline) {
  std::unique_lock lock(mutex);
  return idleChanged.wait_until(lock, deadline, [this] { return queue.empty() && idle == threads.size(); });
}

void ThreadPool::work() {
  std::unique_lock lock(mutex);
  waking = false;
  for (;;) {
    while (queue.empty() && !stopping) {
      ++idle;
      idleChanged.notify_all();
      wake.wait(lock);
      --idle;
      waking = false;
    }
    if (queue.empty()) return;
    Work item = std::move(queue.front());
    queue.pop_front();
    const bool notifies = startsOrWakes();
    lock.unlock();
    if (notifies) wake.notify_one();
    try {
      item();
    } catch (const std::exception& error) {
      stop(error.what());
    }
    item = nullptr;
    lock.lock();
  }
}

}  // namespace platform::linux_
