// Keeps the local replica and the account's other devices in step.
#pragma once

#include <cstddef>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "cloudsyncd/Transport.hpp"
#include "cloudsyncd/core/Document.hpp"
#include "cloudsyncd/core/Pacing.hpp"
#include "cloudsyncd/core/Retry.hpp"
#include "platform/Environment.hpp"
#include "platform/Result.hpp"
#include "platform/Value.hpp"
#include "platform/linux/FileSystem.hpp"
#include "platform/linux/SettingsFile.hpp"

namespace cloudsync {

// One thread, the loop's. Whoever drives it calls timePassed() at deadline().
class Synchroniser : public TransportClient {
 public:
  struct Surroundings {
    platform::linux_::FileSystem& files;
    std::string path;  // of the replica
    platform::linux_::SettingsFile& replica;
    Transport& transport;
    platform::Clock& wall;
    std::function<Steady()> steady;
    std::string account;
    std::string writer;  // a random text, this process's identity
    // Called before the replica goes over to another account; an error stops it.
    std::function<platform::Result<void>()> changing = {};
    // Called once: the account has been taken in, or why it can't be for now.
    std::function<void(const std::string& problem)> settled = {};
    // Called whenever deadline() may be another than before.
    std::function<void()> deadlineMoved = {};
  };
  // What is referred to outlives the object.
  explicit Synchroniser(Surroundings surroundings);

  void start() { around.transport.start(*this); }
  // Another process has written the replica's file.
  void replicaChanged(const platform::Dictionary& before, const platform::Dictionary& after);

  std::optional<Steady> deadline() const;
  void timePassed();

  struct Device {
    platform::Dictionary entries;  // of its newest good document
    std::string problem;           // why a later one was refused
  };
  struct Status {
    bool isConnected = false;
    std::string problem;  // while it is not, or why nothing goes out
    std::optional<platform::Time> disconnectedSince;
    std::optional<platform::Time> lastOut, lastIn;  // an exchange that brought something
    std::vector<std::string> waiting;               // keys that no document holds yet as they are here
    std::string device;                             // this one's name
    std::map<std::string, Device> devices;
  };
  Status status() const;

  // TransportClient
  void connected() override;
  void disconnected(const std::string& problem) override;
  void received(const std::string& device, std::string_view document) override;
  void unreadable(const std::string& device, const std::string& problem) override;
  void removed(const std::string& device) override;
  void published(const std::error_code& error, const std::string& problem) override;
  void deadlineMoved() override;

 private:
  platform::Dictionary allDocuments() const;
  std::string ownDevice() const;
  std::string nameDevice(platform::Dictionary& replica);
  void takeIn();
  void takeIn(const platform::Dictionary& entries);
  platform::Result<bool> change(platform::Dictionary& replica, const platform::Dictionary& entries);
  platform::Result<void> keepAside(const platform::Dictionary& replica, const std::string& account);
  void publishIfNews();
  void publish();
  platform::Result<std::string> encode();
  void exceedsQuota();
  std::optional<Steady> sendingDue() const;
  void fail(Retry& retry, const std::string& text);
  void refuse(const std::string& device, const std::string& problem);
  void settle(const std::string& problem);

  const Surroundings around;
  std::map<std::string, Device> devices;
  std::set<std::string> seen;                              // since the connection began
  std::set<std::pair<std::string, std::string>> refusals;  // told: device and cause
  bool isConnected = false;
  std::string problem;
  std::optional<platform::Time> disconnectedSince, lastOut, lastIn;

  Pacing pacing;
  Retry taking, sending;
  bool isPublishing = false;
  Document underWay;         // that is being published
  std::size_t sentText = 0;  // a hash of what was published last
  std::string knownDevice;
  bool isForeign = false;  // somebody else publishes under this device's name
  bool isOverQuota = false;
  bool isSettled = false;
};

}  // namespace cloudsync
