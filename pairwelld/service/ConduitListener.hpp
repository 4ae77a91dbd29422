// The client service: admits clients by entitlement, and keeps an object for each until it has gone.
#pragma once

#include <memory>
#include <vector>

#include "platform/ServiceListener.hpp"
#include "platform/ThreadAnnotations.hpp"
#include "platform/WorkQueue.hpp"

namespace pairwell {

class ConduitConnection;
class DebugManager;

// One per process. Connections hold it, so it outlives its clients.
class ConduitListener : public platform::ServiceListenerDelegate,
                        public std::enable_shared_from_this<ConduitListener> {
 public:
  using Connections = std::vector<std::shared_ptr<ConduitConnection>>;

  // Written once, before activate(); read by the connections on any thread.
  std::shared_ptr<DebugManager> debugManager;

  // The objects of the admitted clients, in order of admission.
  virtual Connections& connections() PW_REQUIRES(*serialQueue);
  virtual void setConnections(Connections connections) PW_REQUIRES(*serialQueue);
  // Made on first read.
  virtual std::shared_ptr<platform::ServiceListener> conduitListener() PW_REQUIRES(*serialQueue);
  virtual void setConduitListener(std::shared_ptr<platform::ServiceListener> listener)
      PW_REQUIRES(*serialQueue);

  static std::shared_ptr<ConduitListener> create();
  ~ConduitListener() override;

  // Any thread; what they do follows on serialQueue.
  virtual void activate();
  virtual void resumeListener() PW_REQUIRES(*serialQueue);
  virtual void invalidate();
  // Admitted connections stay.
  virtual void invalidateListener() PW_REQUIRES(*serialQueue);
  // The platform reports the end of a connection elsewhere; it is handed over to serialQueue, where
  // admissions append.
  virtual void connectionInvalidated(const std::shared_ptr<ConduitConnection>& connection)
      PW_REQUIRES(*serialQueue);

  bool listenerShouldAcceptNewConnection(
      const std::shared_ptr<platform::ServiceListener>& listener,
      const std::shared_ptr<platform::ClientConnection>& connection) override;

 protected:
  ConduitListener();

 private:
  bool isEntitled(platform::ClientConnection& connection);
  void logDenial(platform::ClientConnection& connection);
  void admit(const std::shared_ptr<platform::ClientConnection>& connection) PW_REQUIRES(*serialQueue);

  Connections connections_ PW_GUARDED_BY(*serialQueue);

 public:
  const std::shared_ptr<platform::SerialQueue> serialQueue;

 private:
  std::shared_ptr<platform::ServiceListener> conduitListener_ PW_GUARDED_BY(*serialQueue);
};

}  // namespace pairwell
