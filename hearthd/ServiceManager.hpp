// What hearthd does: joins jobs, alarms, the broker and the connections.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "hearthd/AlarmFile.hpp"
#include "hearthd/Job.hpp"
#include "hearthd/core/Alarms.hpp"
#include "hearthd/core/Broker.hpp"
#include "hearthd/core/PendingEvents.hpp"
#include "platform/Result.hpp"
#include "platform/linux/BusServer.hpp"
#include "platform/linux/EventLoop.hpp"
#include "platform/linux/FileSystem.hpp"
#include "platform/linux/Paths.hpp"

namespace hearth {

// One thread, the loop's.
class ServiceManager {
 public:
  ServiceManager(platform::linux_::EventLoop& loop, platform::linux_::FileSystem& files,
                 platform::linux_::Paths paths);

  // Binds the sockets and starts the jobs; `ready` is called once every one has been given its first start.
  // After a failure, which is logged, none is started.
  platform::Result<void> start(std::function<void()> ready);
  // `stopped` is called when no job runs any more.
  void stop(std::function<void()> stopped);

  // What connections ask for.
  using Watcher = Broker::Watcher;
  void connected(Watcher watcher, std::shared_ptr<platform::linux_::BusConnection> connection);
  void disconnected(Watcher watcher);
  [[nodiscard]] bool watch(Watcher watcher, const std::string& name) { return broker.watch(watcher, name); }
  void unwatch(Watcher watcher, const std::string& name) { broker.unwatch(watcher, name); }
  // Remembered, and told by tellPosted(): after the server's turn, each name once.
  void post(const std::string& name);
  void tellPosted();

  // The jobs that consume a stream.
  std::vector<std::string> consumers(const std::string& stream) const;
  bool owns(const std::string& job, const std::string& stream) const;
  // Durable before they return, unless the disk refuses: then for this run at once, and durable when it can
  // be. The answers are those of Alarms; of a name's alarms, which nobody sets anew, the refusal.
  std::int64_t setAlarm(const EventKey& key, platform::Date date);
  std::int64_t clearAlarm(const EventKey& key);
  platform::Result<std::size_t> clearAlarms(const std::string& name);
  std::vector<Alarm> listAlarms() const { return alarms.list(); }
  void installHandler(Watcher watcher, const std::string& job, const std::string& stream);
  void taken(const EventKey& key, std::int64_t generation);
  // An event that is no alarm's.
  void deliver(const EventKey& key);

  // No job is started any more.
  bool isStopping() const { return stopping; }
  Job* findJob(const std::string& name) const;
  const std::vector<std::unique_ptr<Job>>& jobs() const { return allJobs; }

 private:
  platform::Result<void> listen();
  platform::Result<void> addJob(JobDescription description);
  platform::Result<void> addServices(const JobDescription& description, Job::Surroundings& surroundings);
  void adoptLink(const std::string& job, platform::linux_::UniqueDescriptor link, pid_t pid);
  void jobEnded(const std::string& job);
  void jobChanged();
  void saveAlarms();
  void alarmsChanged();
  void tell(const std::string& name);
  void deliverDue();
  void emitEvent(const EventKey& key, std::int64_t generation);

  platform::linux_::EventLoop& loop;
  const platform::linux_::Paths paths;
  platform::linux_::FileSystem& files;
  AlarmFile alarmFile;

  Alarms alarms;
  Broker broker;
  PendingEvents pendingEvents;
  // Told after the server's turn, each once: a flood of posts costs its many watchers one notification.
  std::set<std::string> posted;
  platform::linux_::EventSource wallTimer;
  platform::linux_::EventSource steadyTimer;
  platform::linux_::EventSource saveTimer;

  std::vector<platform::linux_::UniqueDescriptor> serviceSockets;
  std::vector<std::unique_ptr<Job>> allJobs;
  bool startedAll = false;
  bool stopping = false;
  std::function<void()> whenReady;
  std::function<void()> whenStopped;

  Watcher lastWatcher = 0;
  std::map<Watcher, std::shared_ptr<platform::linux_::BusConnection>> connections;
  std::map<std::string, Watcher> links;  // by job
  platform::linux_::BusServer server;    // last: its end closes the connections, which call back
  platform::linux_::EventSource serverWatch;
};

}  // namespace hearth
