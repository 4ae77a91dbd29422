// Deadlines of numbered things, on one timer descriptor.
#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <utility>
#include <vector>

#include "platform/linux/UniqueDescriptor.hpp"

namespace platform::linux_ {

// One thread. With no deadline set, nothing wakes.
class DeadlineTimer {
 public:
  using TimePoint = std::chrono::steady_clock::time_point;

  DeadlineTimer();

  // Readable when takePassed() has something to tell; -1 where the system could not make one.
  int descriptor() const { return timer.get(); }
  // One a number; none clears it.
  void set(std::uint64_t number, std::optional<TimePoint> deadline);
  // The numbers whose deadlines have passed, which are set no more.
  std::vector<std::uint64_t> takePassed();

 private:
  void arm();

  const UniqueDescriptor timer;
  std::map<std::uint64_t, TimePoint> byNumber;
  std::set<std::pair<TimePoint, std::uint64_t>> byTime;
  std::optional<TimePoint> armed;
};

}  // namespace platform::linux_
