#include "hearthd/Job.hpp"

#include <signal.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/wait.h>

#include <cerrno>
#include <cstdint>
#include <utility>

#include "hearthd/LifeLock.hpp"
#include "platform/LogSink.hpp"
#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/ProcessLock.hpp"

namespace hearth {
namespace {

using platform::linux_::UniqueDescriptor;

constexpr std::chrono::seconds patience{3};  // between SIGTERM and SIGKILL

const platform::Logger& log() {
  static const platform::Logger logger = platform::hearthLog("hearthd");
  return logger;
}

std::string describeExit(const siginfo_t& info) {
  if (info.si_code == CLD_EXITED) return "exited with status " + std::to_string(info.si_status);
  return "ended by signal " + std::to_string(info.si_status);
}

}  // namespace

Job::Job(platform::linux_::EventLoop& loop_, JobDescription description_, Surroundings surroundings_)
    : loop(loop_), _description(std::move(description_)), surroundings(std::move(surroundings_)) {}

void Job::start() {
  wanted = true;
  restarts.reset();
  if (_state == State::stopped || _state == State::waiting) tryToStart();
}

void Job::stop() {
  wanted = false;
  if (_state == State::running) return terminate();
  if (_state == State::stopping) return;
  timer = {};
  exitWatch = {};
  become(State::stopped);
}

void Job::restart() {
  if (_state == State::running) terminate();
  start();
}

void Job::tryToStart() {
  timer = {};
  auto life = platform::linux_::takeLock(surroundings.lifeLock);
  if (!life) return startLater({}, surroundings.lifeLock + ": " + life.error().message());
  if (!*life) return endOrphans();
  launchWith(std::move(*life));
}

void Job::launchWith(UniqueDescriptor life) {
  int ends[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends) < 0) {
    return startLater({}, platform::linux_::lastError().message());
  }
  UniqueDescriptor own(ends[0]);
  const UniqueDescriptor theirs(ends[1]);
  LaunchRequest request{_description.program, surroundings.environment, surroundings.services};
  request.descriptors.push_back({std::string(platform::linux_::linkDescriptorName), theirs.get()});
  request.descriptors.push_back({std::string(platform::linux_::lifeDescriptorName), life.get()});
  auto result = launch(request);
  if (!result) return startLater({}, _description.program + ": " + result.error().message());

  launched = std::move(*result);
  launchTime = std::chrono::steady_clock::now();
  exitWatch =
      loop.watchDescriptor(launched->process.get(), EPOLLIN, [this](std::uint32_t) { processEnded(); });
  log().default_("%s started as process %d", _description.name, launched->pid);
  surroundings.started(std::move(own), launched->pid);
  become(State::running);
}

void Job::endOrphans() {
  auto handles = endHolders(surroundings.lifeLock);
  if (handles.empty()) {
    return startLater({}, surroundings.lifeLock + ": locked by a process that cannot be found");
  }
  log().default_("%s: ended %d processes that were left of it", _description.name, handles.size());
  // When the first has gone, those that are left are looked for again.
  orphan = std::move(handles.front());
  exitWatch = loop.watchDescriptor(orphan.get(), EPOLLIN, [this](std::uint32_t) {
    exitWatch = {};
    orphan.reset();
    tryToStart();
  });
  become(State::clearing);
}

void Job::startLater(std::chrono::milliseconds ran, const std::string& reason) {
  const auto delay = restarts.delayAfter(ran);
  _detail = reason;
  log().error("%s: %s; next start in %d ms", _description.name, reason, delay.count());
  timer = loop.callAfter(delay, [this] { tryToStart(); });
  become(State::waiting);
}

void Job::terminate() {
  ::kill(-launched->pid, SIGTERM);
  timer = loop.callAfter(patience, [this] {
    log().error("%s did not end when told to: killed", _description.name);
    ::kill(-launched->pid, SIGKILL);
  });
  become(State::stopping);
}

void Job::processEnded() {
  // Before the process is reaped, as its number may be another's afterwards: what is left of its group goes
  // with it.
  ::kill(-launched->pid, SIGKILL);
  siginfo_t info{};
  ::waitid(P_PIDFD, static_cast<id_t>(launched->process.get()), &info, WEXITED);
  const auto ran =
      std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - launchTime);
  timer = {};
  exitWatch = {};
  launched.reset();
  _detail = describeExit(info);
  surroundings.ended();
  const bool told = _state == State::stopping;
  if (!wanted || (!told && !_description.restart)) {
    log().default_("%s %s", _description.name, _detail);
    return become(State::stopped);
  }
  if (told) {
    become(State::waiting);
    return tryToStart();
  }
  startLater(ran, _detail);
}

void Job::become(State next) {
  _state = next;
  surroundings.changed();
}

}  // namespace hearth
