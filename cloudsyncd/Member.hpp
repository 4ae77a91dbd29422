// This device as a member of an account: joins etc/cloud.json, the replica's file, a transport and the loop.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "cloudsyncd/CloudFile.hpp"
#include "cloudsyncd/Synchroniser.hpp"
#include "cloudsyncd/Transports.hpp"
#include "platform/Result.hpp"
#include "platform/Value.hpp"
#include "platform/linux/EventLoop.hpp"
#include "platform/linux/LinuxEnvironment.hpp"
#include "platform/linux/Paths.hpp"
#include "platform/linux/SettingsFile.hpp"

namespace cloudsync {

// One thread, the loop's.
class Member {
 public:
  // The loop and the files outlive the object.
  Member(platform::linux_::EventLoop& loop, platform::linux_::FileSystem& files,
         platform::linux_::Paths paths);

  // Once. False: something is short for now that has to be there from the beginning, and the log says what.
  bool start();
  // As CloudOperation::status answers it.
  platform::Dictionary status() const;
  // `done` gets why it can't be; empty: the device is in that account now.
  void use(const Membership& membership, std::function<void(const std::string& problem)> done);
  void forget(const std::string& device, std::function<void(const std::string& problem)> done);

 private:
  // One account at one engine, and what keeps the replica in step with it.
  struct Connection {
    Membership membership;
    std::shared_ptr<Transport> transport;
    std::unique_ptr<Synchroniser> synchroniser;  // ends first
  };
  std::unique_ptr<Connection> connect(const Membership& membership,
                                      std::function<void(const std::string&)> settled,
                                      std::function<platform::Result<void>()> changing, std::string& problem);
  std::string nameInFile(const Membership& membership);
  void nameFormerInFile(const Membership& refused);
  void rearm();
  void timePassed();

  platform::linux_::EventLoop& loop;
  platform::linux_::FileSystem& files;
  const platform::linux_::Paths paths;
  const std::string replicaPath;
  const std::string writer;
  platform::linux_::LinuxClock wall;
  const std::shared_ptr<platform::linux_::SettingsFile> replica;
  std::string problem;                  // why there is no connection
  std::unique_ptr<Connection> current;  // none where etc/cloud.json names no account
  std::unique_ptr<Connection> next;     // on trial
  platform::linux_::EventSource timer;
};

}  // namespace cloudsync
