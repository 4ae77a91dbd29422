// When what was written here goes out.
#pragma once

#include <algorithm>
#include <chrono>
#include <optional>

namespace cloudsync {

// A switch writes several keys: they go out together, after `quiet` without another, and a device that never
// rests is heard all the same.
class Pacing {
 public:
  using Steady = std::chrono::steady_clock::time_point;
  static constexpr std::chrono::milliseconds quiet{25};
  static constexpr std::chrono::milliseconds patience{500};

  void written(Steady now) {
    if (!first) first = now;
    due = std::min(now + quiet, *first + patience);
  }
  void sent() { first = due = std::nullopt; }
  // When to send; absent while nothing waits.
  std::optional<Steady> deadline() const { return due; }

 private:
  std::optional<Steady> first, due;
};

}  // namespace cloudsync
