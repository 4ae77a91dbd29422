#include "bench/Process.hpp"

#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <sstream>

namespace bench {
namespace {

namespace fs = std::filesystem;

std::string folderOf(pid_t pid) { return "/proc/" + std::to_string(pid); }

bool pinned = false;

void keepTo(int core) {
  cpu_set_t cores;
  CPU_ZERO(&cores);
  CPU_SET(core, &cores);
  if (::sched_setaffinity(0, sizeof cores, &cores) < 0) throw std::runtime_error("cannot pin to a core");
}

}  // namespace

void pin(bool wanted) {
  static const cpu_set_t atFirst = [] {
    cpu_set_t cores;
    ::sched_getaffinity(0, sizeof cores, &cores);
    return cores;
  }();
  pinned = wanted;
  pinned ? keepTo(0) : static_cast<void>(::sched_setaffinity(0, sizeof atFirst, &atFirst));
}

bool isPinned() { return pinned; }

void become(const std::vector<std::string>& command, const std::string& log) {
  std::vector<char*> arguments;
  arguments.reserve(command.size() + 1);
  for (const auto& each : command) arguments.push_back(const_cast<char*>(each.c_str()));
  arguments.push_back(nullptr);
  const int complaints = ::fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, 0);
  ::dup2(::open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600), STDERR_FILENO);
  ::execvp(arguments[0], arguments.data());
  ::dprintf(complaints, "%s: %s\n", arguments[0], std::strerror(errno));
  ::_exit(127);
}

Child::Child(const std::function<void()>& body) : process(::fork()) {
  if (process < 0) throw std::runtime_error("fork");
  if (process > 0) return;
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  [&]() noexcept {  // what fails here must not take away what is the parent's
    if (pinned) keepTo(1);
    body();
  }();
  ::_exit(0);
}

bool Child::hasEnded() const {
  siginfo_t ended{};
  return ::waitid(P_PID, static_cast<id_t>(process), &ended, WEXITED | WNOHANG | WNOWAIT) == 0 &&
         ended.si_pid != 0;
}

void Child::end(int signal) {
  const pid_t pid = std::exchange(process, -1);
  if (pid <= 0) return;
  ::kill(pid, signal);
  ::waitpid(pid, nullptr, 0);
}

Variable::Variable(const char* name_, const std::string& value)
    : name(name_), before(std::getenv(name) ? std::optional<std::string>(std::getenv(name)) : std::nullopt) {
  ::setenv(name, value.c_str(), 1);
}

Variable::~Variable() { before ? ::setenv(name, before->c_str(), 1) : ::unsetenv(name); }

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
