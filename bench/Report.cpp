#include "bench/Report.hpp"

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <stdexcept>

#include "platform/Value.hpp"
#include "platform/linux/Json.hpp"

namespace bench {
namespace {

using platform::Dictionary;

Dictionary results;

}  // namespace

Figure percentiles(std::vector<double> times) {
  std::sort(times.begin(), times.end());
  return {times.at(times.size() / 2), times.at(times.size() * 99 / 100)};
}

void report(const std::string& what, Figure figure, const char* unit) {
  std::printf("%-46s p50 %9.1f %s   p99 %9.1f %s\n", what.c_str(), figure.p50, unit, figure.p99, unit);
  std::fflush(stdout);
  results.emplace(what, Dictionary{{"p50", figure.p50}, {"p99", figure.p99}, {"unit", unit}});
}

void report(const std::string& what, double figure, const char* unit) {
  std::printf("%-46s %13.2f %s\n", what.c_str(), figure, unit);
  std::fflush(stdout);
  results.emplace(what, Dictionary{{"value", figure}, {"unit", unit}});
}

void report(const std::string& what, const std::vector<double>& figures, const char* unit) {
  std::printf("%-46s", what.c_str());
  for (const double figure : figures) std::printf(" %13.2f", figure);
  std::printf(" %s\n", unit);
  std::fflush(stdout);
  results.emplace(what, Dictionary{{"each", platform::List(figures.begin(), figures.end())}, {"unit", unit}});
}

void writeReport(const std::string& path) {
  const auto text = platform::linux_::printJson(results, platform::linux_::JsonStyle::indented);
  if (!text || !(std::ofstream(path) << *text << '\n')) throw std::runtime_error("cannot write " + path);
}

}  // namespace bench
