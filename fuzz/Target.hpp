// A parser of what others wrote, as libFuzzer calls it: with any bytes; and as its corpus is replayed.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);

namespace fuzz {

inline std::string_view textOf(const std::uint8_t* data, std::size_t size) {
  return {reinterpret_cast<const char*>(data), size};
}

// What has to hold whatever came in.
inline void require(bool holds) {
  if (!holds) std::abort();
}

}  // namespace fuzz
