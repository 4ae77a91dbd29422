// When what has failed is tried again.
#pragma once

#include <algorithm>
#include <chrono>
#include <optional>
#include <string>
#include <utility>

namespace cloudsync {

// A full disk is not free a moment later, and whoever has freed it wants to see it noticed.
class Retry {
 public:
  using Steady = std::chrono::steady_clock::time_point;
  static constexpr std::chrono::milliseconds shortest{1000};
  static constexpr std::chrono::milliseconds longest{60'000};

  // Whether `problem` is another than the last time, and so worth a line.
  bool failed(Steady now, std::string problem) {
    due = now + delay;
    delay = std::min(delay * 2, longest);
    const bool isAnother = problem != lastProblem;
    lastProblem = std::move(problem);
    return isAnother;
  }
  void succeeded() { *this = Retry(); }
  // It is being tried.
  void begin() { due.reset(); }
  std::optional<Steady> deadline() const { return due; }
  const std::string& problem() const { return lastProblem; }

 private:
  std::optional<Steady> due;
  std::chrono::milliseconds delay = shortest;
  std::string lastProblem;
};

}  // namespace cloudsync
