#include "platform/WorkQueue.hpp"

#include <condition_variable>
#include <deque>
#include <exception>
#include <mutex>
#include <utility>

#include "platform/Platform.hpp"

namespace platform {
namespace {

// A pool thread has its thread back after this many items, so that one busy queue cannot keep it from the
// others.
constexpr int itemsPerTurn = 64;

// A caller in `sync`, on its own stack.
struct Waiter {
  const Work& work;
  bool granted = false;
  std::condition_variable turn;
};

struct Item {
  Work work;                 // of async
  Waiter* waiter = nullptr;  // of sync
};

// The queues whose items this thread runs, innermost first.
struct Frame {
  const SerialQueue* queue;
  QueueRank rank;
  Frame* outer;
};
thread_local Frame* innermost = nullptr;

class FrameScope {
 public:
  FrameScope(const SerialQueue* queue, QueueRank rank) : frame{queue, rank, innermost} { innermost = &frame; }
  ~FrameScope() { innermost = frame.outer; }

 private:
  Frame frame;
};

void runItem(const Work& work) {
  try {
    work();
  } catch (const std::exception& error) {
    stop(error.what());
  }
}

}  // namespace

// Somebody who runs items, or has been given the queue and is still waking, owns it.
struct SerialQueue::State {
  std::mutex mutex;
  std::deque<Item> items;
  std::deque<Waiter*> waiters;  // callers in `sync` whose item stands in `items` and who do not own the queue
  bool owned = false;
  bool submitted = false;  // a drain job waits in the pool

  // Gives the queue up: to the next caller that waits in `sync`, and only when there is none to the pool. The
  // pool first would deadlock one whose threads all wait in `sync`. True: the caller submits a drain job,
  // unlocked.
  bool handOn() {
    if (!waiters.empty()) {
      Waiter* next = waiters.front();
      waiters.pop_front();
      next->granted = true;
      next->turn.notify_one();  // under the mutex: the condition variable goes with its caller's stack
      return false;
    }
    owned = false;
    return needsSubmit();
  }

  bool needsSubmit() {
    if (owned || submitted || items.empty()) return false;
    return submitted = true;
  }

  // Runs items up to and including that of `own`, or, without one, until the queue is empty, another caller's
  // item comes or the turn is over. The caller owns the queue and gives it up afterwards.
  void drain(const SerialQueue* serving, QueueRank ofRank, const Waiter* own) {
    for (int count = 0; own || count < itemsPerTurn; ++count) {
      Item item;
      {
        std::lock_guard lock(mutex);
        if (items.empty() || (items.front().waiter && items.front().waiter != own)) return;
        item = std::move(items.front());
        items.pop_front();
      }
      const FrameScope scope(serving, ofRank);
      runItem(item.waiter ? item.waiter->work : item.work);
      if (item.waiter) return;
      item.work = nullptr;  // a closure dies while its queue is held and no lock is
    }
  }
};

SerialQueue::SerialQueue(std::string label_, QueueRank rank_, WorkQueue& pool_)
    : _label(std::move(label_)), rank(rank_), pool(pool_), state(std::make_unique<State>()) {}

SerialQueue::~SerialQueue() = default;

void SerialQueue::submit() {
  pool.async([self = shared_from_this()] {
    {
      std::lock_guard lock(self->state->mutex);
      self->state->submitted = false;
      if (self->state->owned) return;  // a caller of `sync` came first, and hands on when it is done
      self->state->owned = true;
    }
    self->drainAndHandOn(nullptr);
  });
}

void SerialQueue::drainAndHandOn(const void* own) {
  // Also when an item threw.
  struct HandOn {
    SerialQueue& queue;
    ~HandOn() {
      bool more;
      {
        std::lock_guard lock(queue.state->mutex);
        more = queue.state->handOn();
      }
      if (more) queue.submit();
    }
  } const handOn{*this};
  state->drain(this, rank, static_cast<const Waiter*>(own));
}

void SerialQueue::async(Work work) {
  const auto self =
      shared_from_this();  // the item may run, and drop the last other reference, before this returns
  bool submitNow;
  {
    std::lock_guard lock(state->mutex);
    state->items.push_back({std::move(work), nullptr});
    submitNow = state->needsSubmit();
  }
  if (submitNow) submit();
}

void SerialQueue::sync(const Work& work) {
  const auto self = shared_from_this();
  for (const Frame* frame = innermost; frame; frame = frame->outer) {
    if (frame->queue == this) stop("sync on " + _label + " from itself: it would wait for ever");
  }
  if (innermost && innermost->rank >= rank) {
    stop("sync on " + _label + " from " + innermost->queue->label() + ": a queue of no lower rank");
  }
  Waiter own{work, false, {}};
  {
    std::unique_lock lock(state->mutex);
    state->items.push_back({nullptr, &own});
    if (state->owned) {
      state->waiters.push_back(&own);
      own.turn.wait(lock, [&] { return own.granted; });
    }
    state->owned = true;
  }
  drainAndHandOn(&own);
}

bool SerialQueue::isCurrent() const { return innermost && innermost->queue == this; }

void SerialQueue::assertCurrent() const {
  if (!isCurrent()) stop("not on " + _label);
}

std::shared_ptr<SerialQueue> Queues::serial(std::string label, QueueRank rank) {
  return std::make_shared<SerialQueue>(std::move(label), rank, *pool);
}

}  // namespace platform
