#include "hearthd/Connection.hpp"

#include <cstdint>
#include <utility>
#include <vector>

#include "hearthd/ServiceManager.hpp"
#include "platform/linux/HearthInterface.hpp"

namespace hearth {
namespace {

using platform::List;
using platform::Value;
using platform::linux_::BusError;
using platform::linux_::BusReply;
using platform::linux_::HearthOperation;

// The server has checked the arguments against the operation's signature.
const std::string& text(const List& arguments, std::size_t index) {
  return *arguments[index].as<std::string>();
}
std::int64_t integer(const List& arguments, std::size_t index) {
  return *arguments[index].as<std::int64_t>();
}

BusError error(std::string_view name, std::string message) { return {std::string(name), std::move(message)}; }
BusError notPermitted(std::string message) {
  return error(platform::linux_::notPermittedError, std::move(message));
}

const char* describe(Job::State state) {
  switch (state) {
    case Job::State::stopped:
      return "stopped";
    case Job::State::waiting:
      return "waiting";
    case Job::State::clearing:
      return "clearing";
    case Job::State::running:
      return "running";
    case Job::State::stopping:
      return "stopping";
  }
  return "unknown";
}

bool isOfLinksAlone(HearthOperation operation) {
  return operation == HearthOperation::installHandler || operation == HearthOperation::taken;
}

bool needsPrivilege(HearthOperation operation) {
  switch (operation) {
    case HearthOperation::deliverEvent:
    case HearthOperation::controlJob:
    case HearthOperation::cancelAlarm:
      return true;
    default:
      return false;
  }
}

}  // namespace

Connection::Connection(ServiceManager& manager_, Broker::Watcher watcher_, Rights rights_)
    : manager(manager_), watcher(watcher_), rights(std::move(rights_)) {}

void Connection::call(std::size_t operation, List arguments, platform::linux_::BusCompletion completion) {
  completion(perform(operation, arguments));
}

void Connection::closed() { manager.disconnected(watcher); }

BusReply Connection::perform(std::size_t index, const List& arguments) {
  const auto operation = static_cast<HearthOperation>(index);
  if (isOfLinksAlone(operation) && rights.job.empty())
    return notPermitted("only a job may do this, on its link");
  if (needsPrivilege(operation) && !rights.privileged) return notPermitted("only root may do this");
  switch (operation) {
    case HearthOperation::post:
      manager.post(text(arguments, 0));
      return List();
    case HearthOperation::watch:
      return watch(text(arguments, 0));
    case HearthOperation::unwatch:
      manager.unwatch(watcher, text(arguments, 0));
      return List();
    case HearthOperation::setEvent:
    case HearthOperation::clearEvent:
      return changeEvent(arguments);
    case HearthOperation::installHandler:
      manager.installHandler(watcher, rights.job, text(arguments, 0));
      return List();
    case HearthOperation::taken:
      manager.taken({rights.job, text(arguments, 0), text(arguments, 1)}, integer(arguments, 2));
      return List();
    case HearthOperation::deliverEvent:
      return deliverEvent(text(arguments, 0), text(arguments, 1));
    case HearthOperation::listJobs:
      return listJobs();
    case HearthOperation::controlJob:
      return controlJob(text(arguments, 0), text(arguments, 1));
    case HearthOperation::listAlarms:
      return listAlarms();
    case HearthOperation::cancelAlarm:
      return cancelAlarm(text(arguments, 0));
  }
  return error(platform::linux_::failedError, "unknown operation");
}

BusReply Connection::watch(const std::string& name) {
  if (manager.watch(watcher, name)) return List();
  return error("org.freedesktop.DBus.Error.LimitsExceeded", "too many names, or too long a one");
}

// With a date as the third argument it sets the event, without one it clears it.
BusReply Connection::changeEvent(const List& arguments) {
  const std::string& stream = text(arguments, 0);
  std::vector<std::string> owners;
  if (!rights.job.empty()) {
    if (!manager.owns(rights.job, stream)) return notPermitted(rights.job + " does not own " + stream);
    owners = {rights.job};
  } else {
    if (!rights.privileged)
      return notPermitted("only the job that owns a stream, or root, may set its events");
    owners = manager.consumers(stream);
    if (owners.empty()) return error(platform::linux_::unknownStreamError, "no job consumes " + stream);
  }
  std::int64_t generation = 0;
  for (const std::string& owner : owners) {
    const EventKey key{owner, stream, text(arguments, 1)};
    generation = arguments.size() > 2 ? manager.setAlarm(key, platform::Date{integer(arguments, 2)})
                                      : manager.clearAlarm(key);
  }
  return List{generation};
}

BusReply Connection::deliverEvent(const std::string& stream, const std::string& name) {
  const auto jobs = manager.consumers(stream);
  if (jobs.empty()) return error(platform::linux_::unknownStreamError, "no job consumes " + stream);
  for (const std::string& job : jobs) manager.deliver({job, stream, name});
  return List();
}

BusReply Connection::controlJob(const std::string& action, const std::string& name) {
  Job* job = manager.findJob(name);
  if (!job) return error(platform::linux_::unknownJobError, "no job is called " + name);
  if (manager.isStopping()) return error(platform::linux_::failedError, "hearthd is being stopped");
  if (action == "start") {
    job->start();
  } else if (action == "stop") {
    job->stop();
  } else if (action == "restart") {
    job->restart();
  } else {
    return error("org.freedesktop.DBus.Error.InvalidArgs", "start, stop or restart, not " + action);
  }
  return List();
}

BusReply Connection::cancelAlarm(const std::string& name) {
  const auto count = manager.clearAlarms(name);
  if (count) return List{static_cast<std::int64_t>(*count)};
  return error(platform::linux_::failedError,
               "cancelled, but a restart may bring it back, as the alarms cannot be stored: " +
                   count.error().message());
}

BusReply Connection::listJobs() const {
  List rows;
  for (const auto& job : manager.jobs()) {
    rows.push_back(
        List{job->description().name, describe(job->state()), std::int64_t{job->pid()}, job->detail()});
  }
  return List{Value(std::move(rows))};  // clang 14 takes a bare list for the whole
}

BusReply Connection::listAlarms() const {
  List rows;
  for (const Alarm& alarm : manager.listAlarms()) {
    rows.push_back(List{alarm.key.job, alarm.key.stream, alarm.key.name, alarm.date.nanoseconds});
  }
  return List{Value(std::move(rows))};  // clang 14 takes a bare list for the whole
}

}  // namespace hearth
