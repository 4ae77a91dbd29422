// The end of a period, as the daemon takes it.
#pragma once

#include <cmath>

namespace tools {

// Whether a stored end time, in seconds since 1970, counts: one without an alarm date is taken for none.
inline bool isEnd(double seconds) {
  constexpr double lastAlarmSecond = 9223372036;
  return seconds > 0 && std::trunc(seconds) <= lastAlarmSecond;
}

}  // namespace tools
