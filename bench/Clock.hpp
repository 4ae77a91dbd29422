#pragma once

#include <chrono>
#include <cstddef>
#include <cstdio>
#include <vector>

namespace bench {

// Microseconds, monotonic, the same clock in every process.
inline double now() {
  return std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

// A moment as a line, for another process.
inline void say(double moment) {
  std::printf("%.3f\n", moment);
  std::fflush(stdout);
}

// Microseconds of each of so many times of `work`, which gets the number of times before; a tenth more come
// first and do not count.
template <class Work>
std::vector<double> times(std::size_t count, Work work) {
  std::vector<double> all;
  for (std::size_t done = 0; done < count + count / 10; ++done) {
    const double start = now();
    work(done);
    if (done >= count / 10) all.push_back(now() - start);
  }
  return all;
}

}  // namespace bench
