// Measures a whole device beside its peers, in one run.
// Usage: pairwell_bench PROGRAMS FOLDER [SUBJECT…]   (all by default)
//        pairwell_bench --compare BEFORE.json AFTER.json
#include <linux/magic.h>
#include <sys/resource.h>
#include <sys/statfs.h>
#include <sys/utsname.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <filesystem>
#include <iterator>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "bench/Clock.hpp"
#include "bench/Process.hpp"
#include "bench/Subjects.hpp"

namespace bench {
namespace {

struct Subject {
  const char* name;
  void (*measure)(const std::string& programs);
  bool isPinnedToo;  // files and waits are no matter of cores
};
constexpr Subject subjects[] = {{"reads", measureReads, true},        {"rates", measureRates, true},
                                {"connects", measureConnects, true},  {"posts", measurePosts, true},
                                {"switches", measureSwitches, false}, {"changes", measureChanges, false},
                                {"starts", measureStarts, false},     {"rest", measureRest, false},
                                {"growth", measureGrowth, false},     {"accounts", measureAccounts, false}};

void measure(const Subject& subject, const std::string& programs, bool pinned, double begin) {
  std::printf("\n%s%s, after %.0f s\n", subject.name, pinned ? ", pinned" : "", (now() - begin) / 1e6);
  std::fflush(stdout);
  pin(pinned);
  subject.measure(programs);
  pin(false);
}

void setConditions() {
  utsname system{};
  ::uname(&system);
  setCondition("kernel", std::string(system.release));
  setCondition("cores", static_cast<std::int64_t>(std::thread::hardware_concurrency()));
  double load = 0;
  ::getloadavg(&load, 1);
  setCondition("load before", load);
  struct statfs files {};
  const std::string folder = std::filesystem::temp_directory_path();
  ::statfs(folder.c_str(), &files);
  setCondition("files in memory", files.f_type == TMPFS_MAGIC);  // then nothing waits for a disk
  setCondition("log", "default level, to a file there");
}

bool isSubject(const std::string& name) {
  return std::any_of(std::begin(subjects), std::end(subjects),
                     [&](const Subject& subject) { return subject.name == name; });
}

// A thousand clients, of more than one service.
void allowDescriptors() {
  rlimit limit{};
  ::getrlimit(RLIMIT_NOFILE, &limit);
  limit.rlim_cur = limit.rlim_max;
  ::setrlimit(RLIMIT_NOFILE, &limit);
}

void run(const std::string& programs, const std::string& folder, const std::vector<std::string>& wanted) {
  for (const auto& name : wanted) {
    if (!isSubject(name)) throw std::runtime_error(name + " is nothing that can be measured");
  }
  allowDescriptors();
  ::unsetenv("HEARTH_LOG_LEVEL");
  setConditions();
  const double begin = now();
  for (const Subject& subject : subjects) {
    if (!wanted.empty() && std::find(wanted.begin(), wanted.end(), subject.name) == wanted.end()) continue;
    measure(subject, programs, false, begin);
    if (subject.isPinnedToo) measure(subject, programs, true, begin);
    writeReport(folder, wanted.empty() ? "bench" : "some");
  }
}

}  // namespace

}  // namespace bench

int main(int count, char** arguments) {
  const bool compares = count > 1 && std::strcmp(arguments[1], "--compare") == 0;
  if (compares ? count != 4 : count < 3) {
    std::fprintf(stderr,
                 "usage: pairwell_bench PROGRAMS FOLDER [SUBJECT…] | --compare BEFORE.json AFTER.json\n");
    return 2;
  }
  try {
    compares ? bench::compareReports(arguments[2], arguments[3])
             : bench::run(arguments[1], arguments[2], {arguments + 3, arguments + count});
  } catch (const std::exception& error) {
    std::fprintf(stderr, "pairwell_bench: %s\n", error.what());
    return 1;
  }
}
