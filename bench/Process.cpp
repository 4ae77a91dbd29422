#include "bench/Process.hpp"

#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <sstream>

namespace bench {
namespace {

namespace fs = std::filesystem;

std::string folderOf(pid_t pid) { return "/proc/" + std::to_string(pid); }

}  // namespace

std::string thisProgram() { return fs::read_symlink("/proc/self/exe"); }

long statusNumber(pid_t pid, const std::string& field, const std::string& task) {
  std::ifstream status(folderOf(pid) + task + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.compare(0, field.size(), field) == 0) return std::stol(line.substr(field.size() + 1));
  }
  throw std::runtime_error("no " + field);
}

double residentMebibytes(pid_t pid, const std::string& field) {
  return static_cast<double>(statusNumber(pid, field)) / 1024;
}

long wakeUps(pid_t pid) {
  long sum = 0;
  for (const auto& task : fs::directory_iterator(folderOf(pid) + "/task"))
    sum += statusNumber(pid, "voluntary_ctxt_switches", "/task/" + task.path().filename().string());
  return sum;
}

std::size_t openDescriptors(pid_t pid) {
  return static_cast<std::size_t>(
      std::distance(fs::directory_iterator(folderOf(pid) + "/fd"), fs::directory_iterator()));
}

double processorSeconds(pid_t pid) {
  std::string line;
  std::getline(std::ifstream(folderOf(pid) + "/stat"), line);
  std::istringstream fields(line.substr(line.rfind(')') + 1));  // a name may have spaces
  std::string skipped;
  for (int count = 0; count < 11; ++count) fields >> skipped;
  double user = 0, kernel = 0;
  fields >> user >> kernel;
  return (user + kernel) / static_cast<double>(::sysconf(_SC_CLK_TCK));
}

}  // namespace bench
