// One client of hearthd, or one job's link: its calls and what it may ask for.
#pragma once

#include <string>

#include "hearthd/core/Broker.hpp"
#include "platform/linux/BusServer.hpp"

namespace hearth {

class ServiceManager;

class Connection : public platform::linux_::BusHandler {
 public:
  struct Rights {
    bool privileged;  // root, or hearthd's own user
    std::string job;  // whose link this is; empty for a client of the socket
  };
  // `manager` outlives the connection.
  Connection(ServiceManager& manager, Broker::Watcher watcher, Rights rights);

  void call(std::size_t operation, platform::List arguments,
            platform::linux_::BusCompletion completion) override;
  void closed() override;

 private:
  platform::linux_::BusReply perform(std::size_t operation, const platform::List& arguments);
  platform::linux_::BusReply watch(const std::string& name);
  platform::linux_::BusReply changeEvent(const platform::List& arguments);
  platform::linux_::BusReply deliverEvent(const std::string& stream, const std::string& name);
  platform::linux_::BusReply controlJob(const std::string& action, const std::string& name);
  platform::linux_::BusReply cancelAlarm(const std::string& name);
  platform::linux_::BusReply listJobs() const;
  platform::linux_::BusReply listAlarms() const;

  ServiceManager& manager;
  const Broker::Watcher watcher;
  const Rights rights;
};

}  // namespace hearth
