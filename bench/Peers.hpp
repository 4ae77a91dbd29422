// What the measured things stand beside: the same work with nothing around it.
#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace bench {

// Microseconds for each of `rounds` round trips of `bytes` bytes over a socket to another process, whose
// reading thread hands each to a second thread that answers.
std::vector<double> pingPongWithHop(std::size_t rounds, std::size_t bytes);

// Microseconds for each of `rounds` times the bare calls of one durable file: open, write, fsync, rename,
// fsync of the folder, `writes` times over.
std::vector<double> bareDurableWrites(const std::string& folder, std::size_t rounds, int writes);

double now();  // microseconds, monotonic

}  // namespace bench
