// One job: its process, its restarts, its end.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "hearthd/JobFile.hpp"
#include "hearthd/Launch.hpp"
#include "hearthd/core/Restarts.hpp"
#include "platform/linux/EventLoop.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

namespace hearth {

class Job {
 public:
  enum class State {
    stopped,
    waiting,   // for its next start
    clearing,  // what a killed predecessor of hearthd left behind is being ended
    running,
    stopping,
  };

  struct Surroundings {
    std::string lifeLock;                             // path of the job's own lock
    std::map<std::string, std::string> environment;   // beside LISTEN_*
    std::vector<LaunchRequest::Descriptor> services;  // owned by someone who outlives the job
    std::function<void(platform::linux_::UniqueDescriptor link, pid_t pid)> started;  // our end of its link
    std::function<void()> ended;                                                      // the process has
    std::function<void()> changed;                                                    // of state
  };

  Job(platform::linux_::EventLoop& loop, JobDescription description, Surroundings surroundings);

  const JobDescription& description() const { return _description; }
  State state() const { return _state; }
  pid_t pid() const { return launched ? launched->pid : 0; }
  // How its last run ended, or why it could not be started.
  const std::string& detail() const { return _detail; }

  // Nothing for one that runs.
  void start();
  // SIGTERM, three seconds later SIGKILL; no restart.
  void stop();
  void restart();

 private:
  void tryToStart();
  void launchWith(platform::linux_::UniqueDescriptor life);
  void endOrphans();
  void startLater(std::chrono::milliseconds ran, const std::string& reason);
  void terminate();
  void processEnded();
  void become(State next);

  platform::linux_::EventLoop& loop;
  const JobDescription _description;
  const Surroundings surroundings;

  State _state = State::stopped;
  bool wanted = false;  // to run
  std::string _detail;
  Restarts restarts;
  std::optional<LaunchedProcess> launched;
  std::chrono::steady_clock::time_point launchTime;
  platform::linux_::UniqueDescriptor orphan;
  platform::linux_::EventSource exitWatch;  // of the process, or of an orphan
  platform::linux_::EventSource timer;      // the next start, or the end of patience
};

}  // namespace hearth
