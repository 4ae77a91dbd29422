// The named client service: the listener, its connections, and the delegate that admits them.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string_view>

#include "platform/RadixUserControllerInterface.hpp"
#include "platform/Value.hpp"
#include "platform/WorkQueue.hpp"

namespace platform {

// One client. Set up by the delegate before resume(); afterwards the platform alone touches it.
class ClientConnection {
 public:
  virtual ~ClientConnection() = default;
  virtual std::int32_t processIdentifier() const = 0;
  // What the machine's administrator granted the peer under `name`, of whatever type.
  virtual std::optional<Value> valueForEntitlement(std::string_view name) = 0;
  virtual void setExportedInterface(std::shared_ptr<const InterfaceDescription> description) = 0;
  // Held until the connection has ended, as is the invalidation handler.
  virtual void setExportedObject(std::shared_ptr<RadixUserControllerInterface> object) = 0;
  // Called once, on a thread of the platform's, after the connection has ended.
  virtual void setInvalidationHandler(std::function<void()> handler) = 0;
  virtual void setRemoteObjectInterface(std::shared_ptr<const InterfaceDescription> description) = 0;
  // Calls of the client arrive from here on, on the I/O thread.
  virtual void resume() = 0;
};

class ServiceListener;

class ServiceListenerDelegate {
 public:
  virtual ~ServiceListenerDelegate() = default;
  // On the listener's queue. True admits the client.
  virtual bool listenerShouldAcceptNewConnection(const std::shared_ptr<ServiceListener>& listener,
                                                 const std::shared_ptr<ClientConnection>& connection) = 0;
};

// Made by Platform::makeServiceListener(). Clients that come before resume() wait.
class ServiceListener {
 public:
  virtual ~ServiceListener() = default;
  virtual void setDelegate(std::weak_ptr<ServiceListenerDelegate> delegate) = 0;
  virtual void setQueue(std::shared_ptr<WorkQueue> queue) = 0;
  virtual void resume() = 0;
  // No further clients are offered; those admitted stay.
  virtual void invalidate() = 0;
};

}  // namespace platform
