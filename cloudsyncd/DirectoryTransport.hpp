// An account in a folder that its devices share: FOLDER/ACCOUNT/DEVICE.json, a file a device, each with one
// writer.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "cloudsyncd/Transport.hpp"
#include "cloudsyncd/core/Retry.hpp"
#include "platform/WorkQueue.hpp"
#include "platform/linux/FileSystem.hpp"

namespace cloudsync {

// How such files get from machine to machine is other programs' work: a network file system, a program that
// keeps folders alike. The folder itself must be there, as it may be a drive that is away; the account's
// folder in it is made.
class DirectoryTransport : public Transport, public std::enable_shared_from_this<DirectoryTransport> {
 public:
  struct Place {
    std::string folder;  // absolute
    std::string account;
    // For a folder whose file system gives no events: how often to look. Absent: its events are trusted.
    std::optional<std::chrono::milliseconds> poll;
  };
  // `queue` is the loop's; the references outlive the object.
  static std::shared_ptr<DirectoryTransport> create(platform::linux_::FileSystem& files,
                                                    platform::WorkQueue& queue,
                                                    std::function<Steady()> steady, Place place);

  void start(TransportClient& client) override;
  void publish(const std::string& device, std::string document) override;
  void forget(const std::string& device, std::function<void(const std::string& problem)> done) override;
  std::optional<Steady> deadline() const override;
  void timePassed(Steady now) override;

 private:
  DirectoryTransport(platform::linux_::FileSystem& files, platform::WorkQueue& queue,
                     std::function<Steady()> steady, Place place);
  void later(std::function<void(DirectoryTransport&)> work);
  void connect();
  platform::Result<void> beginWatching();
  void disconnect(const std::error_code& error);
  void changed(const std::string& name);
  // `all`: where an event says so, the identity of a file that is known already proves nothing.
  void look(bool all);
  void lookAt(const std::string& device, bool always);
  bool hasRoomFor(const std::string& device);
  std::string pathOf(const std::string& device) const { return folder + "/" + device + ".json"; }

  platform::linux_::FileSystem& files;
  platform::WorkQueue& queue;
  const std::function<Steady()> steady;
  const Place place;
  const std::string folder;  // the account's
  TransportClient* client = nullptr;

  bool isConnected = false;
  Retry retry;
  std::optional<Steady> nextLook;  // where it polls, or something could not be read
  // A document that is there, as it was last looked at.
  struct Known {
    platform::linux_::FileIdentity identity;
    Steady since;            // when it was first seen to have it
    bool isSettled = false;  // while it has it, there is nothing to read any more
  };
  std::map<std::string, Known> known;
  bool isCrowded = false;
  // A watch follows what it watches, not its name: one says when the folder around the account's goes.
  std::unique_ptr<platform::linux_::FolderWatch> watch, outerWatch;
};

}  // namespace cloudsync
