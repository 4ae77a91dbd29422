// What was measured: told at once, and kept for the file.
#pragma once

#include <string>
#include <vector>

namespace bench {

struct Figure {
  double p50, p99;
};
Figure percentiles(std::vector<double> times);

void report(const std::string& what, Figure figure, const char* unit);
void report(const std::string& what, double figure, const char* unit);
// One of each server.
void report(const std::string& what, const std::vector<double>& figures, const char* unit);
// Everything reported so far, as JSON.
void writeReport(const std::string& path);

}  // namespace bench
