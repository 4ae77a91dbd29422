// Queues of work: the pool, and serial queues over it.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "platform/ThreadAnnotations.hpp"

namespace platform {

using Work = std::function<void()>;

class WorkQueue {
 public:
  virtual ~WorkQueue() = default;
  // Any thread. Appends and returns. An exception that escapes `work` stops the process with its message.
  virtual void async(Work work) = 0;
};

// `sync` goes only from a queue of lower rank to one of higher rank, so no two queues can wait for each
// other.
enum class QueueRank {
  delivery,  // where others are called: key-value deliveries, admissions
  state,     // where one object's state lives
  list,      // leaves: subscriber lists
};

// A label and a first-in-first-out list of work, drained by at most one thread at a time: normally one of the
// pool's, during `sync` the caller's. So `sync` never needs a free pool thread, items may run on any stack,
// and what they may rely on is the queue alone, never a thread's identity.
class PW_CAPABILITY("queue") SerialQueue : public WorkQueue,
                                           public std::enable_shared_from_this<SerialQueue> {
 public:
  // `pool` outlives the queue. Made by Queues::serial().
  SerialQueue(std::string label, QueueRank rank, WorkQueue& pool);
  ~SerialQueue() override;

  const std::string& label() const { return _label; }

  void async(Work work) override;
  // Runs `work` on the calling thread, in queue order, and returns when it has run. Waiting for a queue that
  // is on the caller's own stack, or for one of a rank not higher than the caller's innermost, stops the
  // process.
  void sync(const Work& work) PW_EXCLUDES(this);

  // Whether the innermost work item of this thread is one of this queue.
  bool isCurrent() const;
  // Stops the process unless isCurrent().
  void assertCurrent() const PW_ASSERT_CAPABILITY(this);

 private:
  struct State;
  void submit();
  void drainAndHandOn(const void* own);  // `own`: the caller's item of `sync`, or null in the pool

  const std::string _label;
  const QueueRank rank;
  WorkQueue& pool;
  const std::unique_ptr<State> state;
};

enum class QualityOfService { default_, utility };

// The maker of queues, over one pool that outlives them all. The global queues and the worker pool are the
// pool itself: it has one class of service.
class Queues {
 public:
  explicit Queues(std::shared_ptr<WorkQueue> pool_) : pool(std::move(pool_)) {}

  std::shared_ptr<SerialQueue> serial(std::string label, QueueRank rank);
  std::shared_ptr<WorkQueue> global(QualityOfService) { return pool; }
  std::shared_ptr<WorkQueue> workers() { return pool; }

 private:
  const std::shared_ptr<WorkQueue> pool;
};

}  // namespace platform
