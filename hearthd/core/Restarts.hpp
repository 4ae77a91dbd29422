// How long a job that has ended waits for its next start.
#pragma once

#include <algorithm>
#include <chrono>
#include <utility>

namespace hearth {

// Grows while the job keeps ending soon after its start, so that a broken one costs nothing.
class Restarts {
 public:
  static constexpr std::chrono::milliseconds first{100};
  static constexpr std::chrono::milliseconds longest{60'000};
  static constexpr std::chrono::milliseconds soundRun{10'000};  // a job that ran this long starts afresh

  // `ran` is zero for a job that could not be started.
  std::chrono::milliseconds delayAfter(std::chrono::milliseconds ran) {
    if (ran >= soundRun) next = first;
    return std::exchange(next, std::min(next * 2, longest));
  }
  // An operator starts it.
  void reset() { next = first; }

 private:
  std::chrono::milliseconds next = first;
};

}  // namespace hearth
