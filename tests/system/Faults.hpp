// What a test and the library that it preloads into a device's processes share: a page of a file that both
// map.
#pragma once

#include <atomic>
#include <cerrno>

namespace faults {

// As bits: what a system call can be made to answer.
enum Kind { none = 0, full = 1, broken = 2, interrupted = 4, noDescriptor = 8, partial = 16 };

inline int errorOf(int kind) {
  return kind == full ? ENOSPC : kind == broken ? EIO : kind == interrupted ? EINTR : EMFILE;
}

struct Control {
  char program[32];         // in whose processes calls are counted
  std::atomic<int> kind;    // of the calls that are counted, the one that is answered
  std::atomic<int> calls;   // since the test set it to 0
  std::atomic<int> failAt;  // the call of this number fails; none for 0
  char failed[256];         // which one it was
};

}  // namespace faults
