// The named client service: clients of a socket that hearthd holds, served in the D-Bus message format.
#pragma once

#include <functional>
#include <memory>
#include <string_view>

#include "platform/ServiceListener.hpp"
#include "platform/linux/BusServer.hpp"
#include "platform/linux/Entitlements.hpp"
#include "platform/linux/EventLoop.hpp"

namespace platform::linux_ {

// The client interface as the message format has it, on an object named after the service: dots become
// slashes.
BusInterface clientInterface(std::string_view serviceName);

class BusServiceListener : public ServiceListener, public std::enable_shared_from_this<BusServiceListener> {
 public:
  // `io`, on whose thread clients are served, and `entitlements` outlive the object. Without a socket nobody
  // comes.
  static std::shared_ptr<BusServiceListener> create(EventLoop& io, Entitlements& entitlements,
                                                    std::string_view serviceName, UniqueDescriptor socket);
  ~BusServiceListener() override;

  void setDelegate(std::weak_ptr<ServiceListenerDelegate> delegate) override;
  void setQueue(std::shared_ptr<WorkQueue> queue) override;
  void resume() override;
  void invalidate() override;

  // For the end of the process: accepting and reading stop; `drained` is called on the I/O thread once no
  // answer is left to be made or to leave.
  void drain(std::function<void()> drained);

 private:
  BusServiceListener(EventLoop& io, Entitlements& entitlements, std::string_view serviceName,
                     UniqueDescriptor socket);
  void admit(const PeerIdentity& peer, BusServer::Decide decide);

  EventLoop& io;
  Entitlements& entitlements;
  // Set before resume().
  std::weak_ptr<ServiceListenerDelegate> delegate;
  std::shared_ptr<WorkQueue> queue;
  // The I/O thread's.
  UniqueDescriptor socket;
  std::unique_ptr<BusServer> server;
  EventSource watch;
};

}  // namespace platform::linux_
