// What the benchmarks see of processes, and of what takes its time.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <functional>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace bench {

// `what` is the complaint if it takes too long, as it is by then.
template <class Condition>
void await(const std::string& what, Condition condition,
           std::chrono::seconds limit = std::chrono::seconds(60)) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) throw std::runtime_error(what);
    std::this_thread::sleep_for(std::chrono::microseconds(200));
  }
}

// From now on this process keeps to one core, and what it starts to another; or all to any.
void pin(bool wanted);
bool isPinned();

// Makes this process the program, found as a shell does; `log` is where its standard error goes.
[[noreturn]] void become(const std::vector<std::string>& command, const std::string& log = "/dev/null");

// A process that is gone with its owner.
class Child {
 public:
  // Runs `body` in it, then ends.
  explicit Child(const std::function<void()>& body);
  explicit Child(const std::vector<std::string>& command) : Child([&] { become(command); }) {}
  ~Child() { end(); }
  Child(Child&& other) noexcept : process(std::exchange(other.process, -1)) {}

  pid_t pid() const { return process; }
  bool hasEnded() const;  // by itself
  void end(int signal = 9);

 private:
  pid_t process;
};

// A variable of the environment, until its owner is gone.
class Variable {
 public:
  Variable(const char* name, const std::string& value);
  ~Variable();
  Variable(const Variable&) = delete;
  Variable& operator=(const Variable&) = delete;

 private:
  const char* const name;
  const std::optional<std::string> before;
};

std::string thisProgram();
// A field of /proc/PID/status; of a thread, `task` is "/task/TID".
long statusNumber(pid_t pid, const std::string& field, const std::string& task = "");
double residentMebibytes(pid_t pid, const std::string& field = "VmRSS");
long wakeUps(pid_t pid);
std::size_t openDescriptors(pid_t pid);
double processorSeconds(pid_t pid);  // used since its start

}  // namespace bench
