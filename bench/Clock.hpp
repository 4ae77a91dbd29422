#pragma once

#include <chrono>

namespace bench {

// Microseconds, monotonic, the same clock in every process.
inline double now() {
  return std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

}  // namespace bench
