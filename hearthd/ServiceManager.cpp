#include "hearthd/ServiceManager.hpp"

#include <sys/epoll.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <iterator>
#include <utility>

#include "hearthd/Connection.hpp"
#include "hearthd/ListeningSocket.hpp"
#include "platform/EventStreams.hpp"
#include "platform/LogSink.hpp"
#include "platform/linux/HearthInterface.hpp"

namespace hearth {
namespace {

constexpr std::chrono::seconds untilSavedAgain{10};

using platform::linux_::HearthSignal;
using platform::linux_::PeerIdentity;
using platform::linux_::UniqueDescriptor;

const platform::Logger& log() {
  static const platform::Logger logger = platform::hearthLog("hearthd");
  return logger;
}

Moment now() {
  return {std::chrono::system_clock::now().time_since_epoch(),
          std::chrono::steady_clock::now().time_since_epoch()};
}

bool contains(const std::vector<std::string>& list, const std::string& text) {
  return std::find(list.begin(), list.end(), text) != list.end();
}

// What a job's contract asks for, and nothing else of ours.
std::map<std::string, std::string> environmentOf(const JobDescription& job, const std::string& root) {
  auto environment = job.environment;
  if (!job.services.empty()) environment["CONDUIT_SERVICE_NAME"] = job.services.front();
  if (!root.empty()) environment["HEARTH_ROOT"] = root;
  for (const char* name : {"HEARTH_LOG_PRIVATE", "HEARTH_LOG_LEVEL"}) {
    if (const char* value = std::getenv(name)) environment[name] = value;
  }
  return environment;
}

}  // namespace

ServiceManager::ServiceManager(platform::linux_::EventLoop& loop_, platform::linux_::FileSystem& files_,
                               platform::linux_::Paths paths_)
    : loop(loop_),
      paths(std::move(paths_)),
      files(files_),
      alarmFile(files_, paths.alarms()),
      server(platform::linux_::hearthInterface()) {}

platform::Result<void> ServiceManager::start(std::function<void()> ready) {
  auto stored = alarmFile.load();
  if (!stored) return stored.error();
  alarms = std::move(*stored);
  if (const auto listening = listen(); !listening) {
    log().error("%s: %s", paths.hearthdSocket(), listening.error().message());
    return listening;
  }
  whenReady = std::move(ready);
  auto descriptions = readJobs(files, paths.jobs(), paths.root);
  if (!descriptions) return descriptions.error();
  for (JobDescription& description : *descriptions) {
    const auto added = addJob(std::move(description));
    if (!added && mayPass(added.error())) return added;
  }
  if (allJobs.empty()) log().default_("%s: no jobs; hearthctl init lays out a device", paths.jobs());
  for (const auto& job : allJobs) job->start();
  startedAll = true;
  jobChanged();
  return {};
}

void ServiceManager::stop(std::function<void()> stopped) {
  server.stopListening();
  stopping = true;
  whenReady = nullptr;
  whenStopped = std::move(stopped);
  if (saveTimer) saveAlarms();
  for (const auto& job : allJobs) job->stop();
  jobChanged();
}

platform::Result<void> ServiceManager::listen() {
  auto socket = listenAt(paths.hearthdSocket());
  if (!socket) return socket.error();
  server.listen(std::move(*socket), [this](PeerIdentity peer, platform::linux_::BusServer::Decide decide) {
    const Watcher watcher = ++lastWatcher;
    const bool privileged = peer.uid == 0 || peer.uid == ::geteuid();
    decide({std::make_shared<Connection>(*this, watcher, Connection::Rights{privileged, ""}),
            [this, watcher](auto connection) { connected(watcher, std::move(connection)); }});
  });
  serverWatch = loop.watchDescriptor(server.descriptor(), EPOLLIN, [this](std::uint32_t) {
    server.dispatch();
    tellPosted();
  });
  return {};
}

platform::Result<void> ServiceManager::addJob(JobDescription description) {
  Job::Surroundings surroundings;
  const std::string name = description.name;
  surroundings.lifeLock = paths.run + "/" + name + ".life";
  surroundings.environment = environmentOf(description, paths.root);
  surroundings.started = [this, name](UniqueDescriptor link, pid_t pid) {
    adoptLink(name, std::move(link), pid);
  };
  surroundings.ended = [this, name] { jobEnded(name); };
  surroundings.changed = [this] { jobChanged(); };
  if (const auto added = addServices(description, surroundings); !added) return added;
  broker.listMatching(name, description.matching);
  allJobs.push_back(std::make_unique<Job>(loop, std::move(description), std::move(surroundings)));
  return {};
}

// The sockets are bound once, and stay while the job restarts: its clients wait meanwhile.
platform::Result<void> ServiceManager::addServices(const JobDescription& description,
                                                   Job::Surroundings& surroundings) {
  std::vector<UniqueDescriptor>
      bound;  // closed with a job that is skipped, or its clients would wait for ever
  for (const std::string& service : description.services) {
    auto socket = listenAt(paths.serviceSocket(service));
    if (!socket) {
      log().error("%s: %s: %s; %s", description.name, paths.serviceSocket(service), socket.error().message(),
                  mayPass(socket.error()) ? "hearthd ends" : "the job is skipped");
      return socket.error();
    }
    surroundings.services.push_back({service, socket->get()});
    bound.push_back(std::move(*socket));
  }
  std::move(bound.begin(), bound.end(), std::back_inserter(serviceSockets));
  return {};
}

void ServiceManager::adoptLink(const std::string& job, UniqueDescriptor link, pid_t pid) {
  const Watcher watcher = ++lastWatcher;
  PeerIdentity peer;
  peer.pid = pid;
  peer.uid = ::geteuid();
  peer.gid = ::getegid();
  links[job] = watcher;
  connected(watcher,
            server.adopt(std::move(link), std::move(peer),
                         std::make_shared<Connection>(*this, watcher, Connection::Rights{false, job})));
}

// Its connection stays: what the job sent last, a post perhaps, may still be unread. It ends by itself.
void ServiceManager::jobEnded(const std::string& job) {
  links.erase(job);
  alarms.jobEnded(job);
  pendingEvents.jobEnded(job);
  deliverDue();
}

void ServiceManager::jobChanged() {
  const auto any = [this](auto test) {
    return std::any_of(allJobs.begin(), allJobs.end(), [&](const auto& job) { return test(job->state()); });
  };
  if (whenReady && startedAll && !any([](Job::State state) { return state == Job::State::clearing; })) {
    std::exchange(whenReady, nullptr)();
  }
  if (whenStopped && !any([](Job::State state) { return state != Job::State::stopped; })) {
    std::exchange(whenStopped, nullptr)();
  }
}

void ServiceManager::connected(Watcher watcher, std::shared_ptr<platform::linux_::BusConnection> connection) {
  connections[watcher] = std::move(connection);
}

void ServiceManager::disconnected(Watcher watcher) {
  broker.remove(watcher);
  connections.erase(watcher);
}

void ServiceManager::post(const std::string& name) { posted.insert(name); }

void ServiceManager::tellPosted() {
  for (const std::string& name : std::exchange(posted, {})) tell(name);
}

void ServiceManager::tell(const std::string& name) {
  const platform::List arguments{name};
  const std::string mergeKey = "notification:" + name;
  for (const Watcher watcher : broker.watchers(name)) {
    const auto found = connections.find(watcher);
    if (found == connections.end()) continue;
    const auto connection = found->second;  // writing may find it dead
    connection->emit(static_cast<std::size_t>(HearthSignal::notification), arguments, mergeKey);
  }
  for (const std::string& job : broker.matchingJobs(name))
    deliver({job, std::string(platform::EventStreams::matching), name});
}

std::vector<std::string> ServiceManager::consumers(const std::string& stream) const {
  std::vector<std::string> names;
  for (const auto& job : allJobs) {
    const std::string& name = job->description().name;
    if (owns(name, stream) || pendingEvents.hasHandler(name, stream)) names.push_back(name);
  }
  return names;
}

bool ServiceManager::owns(const std::string& job, const std::string& stream) const {
  const Job* found = findJob(job);
  return found && contains(found->description().streams, stream);
}

// A period whose alarm a full disk refuses would otherwise have no end. What is not stored is set anew by its
// job after a restart, or comes once more.
void ServiceManager::saveAlarms() {
  saveTimer = {};
  const auto saved = alarmFile.save(alarms);
  if (saved || saved.error() == platform::Outcome::malformedFile) return;  // a damaged one stays
  saveTimer = loop.callAfter(untilSavedAgain, [this] { saveAlarms(); });
}

void ServiceManager::alarmsChanged() {
  saveAlarms();
  deliverDue();
}

std::int64_t ServiceManager::setAlarm(const EventKey& key, platform::Date date) {
  const auto generation = alarms.set(key, date);
  alarmsChanged();
  return generation;
}

std::int64_t ServiceManager::clearAlarm(const EventKey& key) {
  const bool isStored = alarms.contains(key);
  const auto generation = alarms.clear(key);
  if (isStored) alarmsChanged();
  return generation;
}

platform::Result<std::size_t> ServiceManager::clearAlarms(const std::string& name) {
  const auto count = alarms.clearNamed(name);
  if (count == 0) return count;
  alarmsChanged();
  if (alarmFile.problem()) return alarmFile.problem();
  return count;
}

void ServiceManager::installHandler(Watcher watcher, const std::string& job, const std::string& stream) {
  const auto link = links.find(job);
  if (link == links.end() || link->second != watcher) return;  // read after the job has ended
  alarms.handlerInstalled(job, stream, now());
  for (const std::string& name : pendingEvents.handlerInstalled(job, stream))
    emitEvent({job, stream, name}, 0);
  deliverDue();
}

void ServiceManager::taken(const EventKey& key, std::int64_t generation) {
  if (alarms.taken(key, generation)) saveAlarms();
}

void ServiceManager::deliver(const EventKey& key) {
  if (pendingEvents.add(key.job, key.stream, key.name)) emitEvent(key, 0);
}

void ServiceManager::deliverDue() {
  for (const Alarm& alarm : alarms.takeDue(now())) emitEvent(alarm.key, alarm.generation);
  const Moment moment = now();
  const Alarms::Next next = alarms.next(moment);
  wallTimer = {};
  steadyTimer = {};
  if (next.wall) wallTimer = loop.callAt(*next.wall, [this] { deliverDue(); });
  if (next.steady) {
    steadyTimer = loop.callAfter(std::chrono::ceil<std::chrono::microseconds>(*next.steady - moment.steady),
                                 [this] { deliverDue(); });
  }
}

void ServiceManager::emitEvent(const EventKey& key, std::int64_t generation) {
  const auto link = links.find(key.job);
  if (link == links.end()) return;
  const auto found = connections.find(link->second);
  if (found == connections.end()) return;
  const auto connection = found->second;
  // An event by hand must not take the place of an alarm's, whose generation the job has to give back.
  const std::string kind = generation == 0 ? "event:" : "alarm:";
  connection->emit(static_cast<std::size_t>(HearthSignal::event), {key.stream, key.name, generation},
                   kind + key.stream + ":" + key.name);
}

Job* ServiceManager::findJob(const std::string& name) const {
  for (const auto& job : allJobs) {
    if (job->description().name == name) return job.get();
  }
  return nullptr;
}

}  // namespace hearth
