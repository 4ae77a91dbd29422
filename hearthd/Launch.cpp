#include "hearthd/Launch.hpp"

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "hearthd/ProcessHandle.hpp"

namespace hearth {
namespace {

constexpr int firstDescriptor = 3;

// Everything that the child needs. Between fork and exec only system calls are made, so it is all built
// before.
struct Prepared {
  explicit Prepared(const LaunchRequest& request) : program(request.program) {
    std::string names;
    for (const auto& [name, descriptor] : request.descriptors) {
      if (!names.empty()) names += ':';
      names += name;
      descriptors.push_back(descriptor);
    }
    for (const auto& [name, value] : request.environment) texts.push_back(name + "=" + value);
    texts.push_back("LISTEN_FDS=" + std::to_string(descriptors.size()));
    texts.push_back("LISTEN_FDNAMES=" + names);
    texts.push_back("LISTEN_PID=          ");  // room for the child's pid
    for (std::string& text : texts) environment.push_back(text.data());
    environment.push_back(nullptr);
    pidDigits = texts.back().data() + std::strlen("LISTEN_PID=");
  }

  std::string program;
  std::vector<std::string> texts;
  std::vector<char*> environment;
  std::vector<int> descriptors;
  char* pidDigits;
};

[[noreturn]] void fail(int report) {
  const int error = errno;
  [[maybe_unused]] const ssize_t written = ::write(report, &error, sizeof error);
  ::_exit(127);
}

void writeDigits(char* place, pid_t number) {
  char reversed[12];
  int length = 0;
  for (; number > 0; number /= 10) reversed[length++] = static_cast<char>('0' + number % 10);
  while (length > 0) *place++ = reversed[--length];
  *place = '\0';
}

void resetSignals() {
  for (int signal = 1; signal < NSIG; ++signal) ::signal(signal, SIG_DFL);
  sigset_t none;
  sigemptyset(&none);
  ::sigprocmask(SIG_SETMASK, &none, nullptr);
}

// In two steps, since a descriptor may stand where another is to go.
void placeDescriptors(std::vector<int>& descriptors, int report) {
  const int free = firstDescriptor + static_cast<int>(descriptors.size());
  for (int& descriptor : descriptors) {
    descriptor = ::fcntl(descriptor, F_DUPFD_CLOEXEC, free);
    if (descriptor < 0) fail(report);
  }
  int place = firstDescriptor;
  for (const int descriptor : descriptors) {
    if (::dup2(descriptor, place++) < 0) fail(report);
  }
}

[[noreturn]] void runChild(Prepared& prepared, pid_t parent, int report) {
  ::setpgid(0, 0);
  ::prctl(PR_SET_PDEATHSIG, SIGTERM);
  if (::getppid() != parent) ::_exit(127);  // the parent ended before it could be watched
  // The pipe must not lie where the descriptors go.
  report = ::fcntl(report, F_DUPFD_CLOEXEC, firstDescriptor + static_cast<int>(prepared.descriptors.size()));
  if (report < 0) ::_exit(127);
  placeDescriptors(prepared.descriptors, report);
  const int null = ::open("/dev/null", O_RDONLY);
  if (null != STDIN_FILENO && (::dup2(null, STDIN_FILENO) < 0 || ::close(null) < 0)) fail(report);
  if (::chdir("/") < 0) fail(report);
  ::umask(022);
  writeDigits(prepared.pidDigits, ::getpid());
  char* const arguments[] = {prepared.program.data(), nullptr};
  resetSignals();
  ::execve(prepared.program.c_str(), arguments, prepared.environment.data());
  fail(report);
}

using platform::linux_::lastError;

}  // namespace

platform::Result<LaunchedProcess> launch(const LaunchRequest& request) {
  Prepared prepared(request);
  int ends[2];
  if (::pipe2(ends, O_CLOEXEC) < 0) return lastError();
  platform::linux_::UniqueDescriptor readEnd(ends[0]);
  platform::linux_::UniqueDescriptor writeEnd(ends[1]);

  const pid_t parent = ::getpid();
  LaunchedProcess launched;
  launched.pid = ::fork();
  if (launched.pid < 0) return lastError();
  if (launched.pid == 0) runChild(prepared, parent, writeEnd.get());
  launched.process = openProcess(launched.pid);

  // Closed by exec, so the end of the file is success.
  writeEnd.reset();
  int error = 0;
  ssize_t count;
  do {
    count = ::read(readEnd.get(), &error, sizeof error);
  } while (count < 0 && errno == EINTR);
  if (count == 0 && launched.process) return launched;
  if (count != sizeof error) error = errno;
  if (count == 0) ::kill(launched.pid, SIGKILL);  // it runs, and could not be watched
  ::waitpid(launched.pid, nullptr, 0);
  return std::error_code(error, std::system_category());
}

}  // namespace hearth
