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
  std::lock_guard lock(mutex);
  queue.push_back(std::move(item));
  if (!waking) wakeOne();
}

void ThreadPool::wakeOne() {
  if (idle > 0) {
    waking = true;
    wake.notify_one();
  } else if (threads.size() < maximum && !stopping) {
    waking = true;
    threads.emplace_back([this] { work(); });
  }
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
    if (!queue.empty() && !waking) wakeOne();
    lock.unlock();
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
