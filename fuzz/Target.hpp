// A parser of what others wrote, as libFuzzer calls it: with any bytes; and as its corpus is replayed.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string_view>

#include "tests/linux/files/World.hpp"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

namespace fuzz {

struct World : platform::linux_::World {
  void TestBody() override {}
};

inline std::string_view textOf(const std::uint8_t* data, std::size_t size) {
  return {reinterpret_cast<const char*>(data), size};
}

// What has to hold whatever came in.
inline void require(bool holds, int line = __builtin_LINE()) {
  if (holds) return;
  std::fprintf(stderr, "what line %d requires does not hold\n", line);
  std::abort();
}

}  // namespace fuzz
