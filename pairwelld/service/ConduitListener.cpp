#include "pairwelld/service/ConduitListener.hpp"

#include <string_view>
#include <utility>

#include "pairwelld/Log.hpp"
#include "pairwelld/Names.hpp"
#include "pairwelld/debug/DebugManager.hpp"
#include "pairwelld/service/ConduitConnection.hpp"
#include "platform/Platform.hpp"

namespace pairwell {
namespace {

constexpr std::string_view internalEntitlement = "com.kestrel.bluetooth.internal";

// Only the boolean grants: 1 or "true" do not.
bool grants(platform::ClientConnection& connection, std::string_view entitlement) {
  const auto value = connection.valueForEntitlement(entitlement);
  const bool* granted = value ? value->as<bool>() : nullptr;
  return granted && *granted;
}

}  // namespace

std::shared_ptr<ConduitListener> ConduitListener::create() {
  return std::shared_ptr<ConduitListener>(new ConduitListener);
}

ConduitListener::ConduitListener()
    : serialQueue(platform::current().queues().serial("com.kestrel.pairwell.conduit.serial",
                                                      platform::QueueRank::delivery)) {}

ConduitListener::~ConduitListener() = default;

ConduitListener::Connections& ConduitListener::connections() { return connections_; }

void ConduitListener::setConnections(Connections connections) { connections_.swap(connections); }

std::shared_ptr<platform::ServiceListener> ConduitListener::conduitListener() {
  if (!conduitListener_) {
    conduitListener_ = platform::current().makeServiceListener(names::service);
    conduitListener_->setDelegate(weak_from_this());
    conduitListener_->setQueue(serialQueue);
  }
  return conduitListener_;
}

void ConduitListener::setConduitListener(std::shared_ptr<platform::ServiceListener> listener) {
  conduitListener_ = std::move(listener);
}

void ConduitListener::activate() {
  serialQueue->async([weak = weak_from_this()] {
    auto self = weak.lock();
    if (!self) return;
    self->serialQueue->assertCurrent();
    Log::conduit().default_("Activate Pairwell Controller Conduit Service");
    self->resumeListener();
  });
}

void ConduitListener::resumeListener() { conduitListener()->resume(); }

void ConduitListener::invalidate() {
  serialQueue->async([weak = weak_from_this()] {
    auto self = weak.lock();
    if (!self) return;
    self->serialQueue->assertCurrent();
    Log::conduit().default_("Invalidate Pairwell Controller Conduit Service");
    self->invalidateListener();
  });
}

void ConduitListener::invalidateListener() { conduitListener()->invalidate(); }

void ConduitListener::connectionInvalidated(const std::shared_ptr<ConduitConnection>& connection) {
  connection->invalidated();
  Connections rest;
  for (const auto& entry : connections()) {
    if (entry != connection) rest.push_back(entry);
  }
  setConnections(std::move(rest));
}

bool ConduitListener::listenerShouldAcceptNewConnection(
    const std::shared_ptr<platform::ServiceListener>& listener,
    const std::shared_ptr<platform::ClientConnection>& connection) {
  serialQueue->assertCurrent();
  if (!isEntitled(*connection)) {
    logDenial(*connection);
    return false;
  }
  if (listener != conduitListener()) {
    Log::conduit().error("Conduit connection denied bad listener, %d", connection->processIdentifier());
    return false;
  }
  admit(connection);
  return true;
}

bool ConduitListener::isEntitled(platform::ClientConnection& connection) {
  return grants(connection, names::systemEntitlement) || grants(connection, internalEntitlement);
}

void ConduitListener::logDenial(platform::ClientConnection& connection) {
  if (platform::current().deviceProperties().isInternalBuild() != 0) {
    Log::conduit().error("Conduit connection denied, %d, add %s entitlement", connection.processIdentifier(),
                         names::systemEntitlement);
  } else {
    Log::conduit().error("Conduit connection denied, %d", connection.processIdentifier());
  }
}

void ConduitListener::admit(const std::shared_ptr<platform::ClientConnection>& connection) {
  const auto client = ConduitConnection::create(shared_from_this(), serialQueue, connection);
  connections().push_back(client);
  connection->setExportedInterface(platform::RadixUserControllerConduitInterface());
  connection->setExportedObject(client);
  // Holds `client` until the platform drops the handler at the connection's end. It may be called on any
  // thread; whether the listener still lives is decided when its queue comes to it.
  connection->setInvalidationHandler([weak = weak_from_this(), queue = serialQueue, client] {
    queue->async([weak, client] {
      auto self = weak.lock();
      if (!self) return;
      self->serialQueue->assertCurrent();
      self->connectionInvalidated(client);
    });
  });
  connection->setRemoteObjectInterface(platform::RadixUserControllerConduitInterface());
  connection->resume();
  Log::conduit().default_("Conduit connection started: %d", connection->processIdentifier());
}

}  // namespace pairwell
