// Usage: simulate [--seeds N] [--devices M] [--from SEED]. Shows its progress; ends with the first seed that
// fails.
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <cstdio>

#include "tests/simulation/Simulation.hpp"

namespace {

void tellFailure(std::uint64_t seed, int devices, const std::string& failure) {
  std::printf("seed %llu: %s\n", static_cast<unsigned long long>(seed), failure.c_str());
  const auto all = simulation::drawEvents(seed, devices);
  const auto events = simulation::shorten(seed, all, devices, failure);
  simulation::Counts ignored;
  const auto shortened = simulation::run(seed, events, devices, ignored);
  std::printf("shortened to %zu of %zu events: %s\n", events.size(), all.size(),
              shortened.value_or("?").c_str());
  for (const auto& event : events) std::printf("  %s\n", event.text().c_str());
}

}  // namespace

int main(int count, char** arguments) {
  long seeds = 1000;
  int devices = 5;
  std::uint64_t from = 1;
  CLI::App app("Simulates the devices of an account.", "simulate");
  app.add_option("--seeds", seeds)->capture_default_str();
  app.add_option("--devices", devices)->capture_default_str()->check(CLI::Range(1, 100));
  app.add_option("--from", from, "the first seed")->capture_default_str();
  CLI11_PARSE(app, count, arguments);

  const bool isWatched = ::isatty(STDERR_FILENO) != 0;
  simulation::Counts counts;
  for (std::uint64_t seed = from; seed < from + static_cast<std::uint64_t>(seeds); ++seed) {
    if (isWatched) std::fprintf(stderr, "\rseed %llu ", static_cast<unsigned long long>(seed));
    if (const auto failure = simulation::run(seed, simulation::drawEvents(seed, devices), devices, counts)) {
      tellFailure(seed, devices, *failure);
      return 1;
    }
  }
  if (isWatched) std::fputs("\r", stderr);
  std::printf("%s\n", counts.text().c_str());
}
