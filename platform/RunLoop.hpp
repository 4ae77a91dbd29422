// The main thread's loop.
#pragma once

#include <memory>

#include "platform/WorkQueue.hpp"

namespace platform {

class RunLoop {
 public:
  virtual ~RunLoop() = default;
  // Main thread. Returns once stop() was called.
  virtual void run() = 0;
  // Any thread.
  virtual void stop() = 0;
  // Work for the main thread; it has no `sync`.
  virtual std::shared_ptr<WorkQueue> mainQueue() = 0;
};

}  // namespace platform
