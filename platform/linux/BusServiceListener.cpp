#include "platform/linux/BusServiceListener.hpp"

#include <sys/epoll.h>

#include <algorithm>
#include <optional>
#include <string>
#include <utility>

namespace platform::linux_ {
namespace {

// One client. Set up on the listener's queue; from the decision on the I/O thread's alone.
class BusClientConnection : public ClientConnection, public BusHandler {
 public:
  BusClientConnection(Entitlements& source_, PeerIdentity peer_) : source(source_), peer(std::move(peer_)) {}

  std::int32_t processIdentifier() const override { return peer.pid; }
  std::optional<Value> valueForEntitlement(std::string_view name) override {
    if (!entitlements) entitlements = source.of(peer);
    return valueOf(*entitlements, name);
  }
  void setExportedInterface(std::shared_ptr<const InterfaceDescription> exported) override {
    description = std::move(exported);
  }
  void setExportedObject(std::shared_ptr<RadixUserControllerInterface> exported) override {
    object = std::move(exported);
  }
  void setInvalidationHandler(std::function<void()> handler) override { invalidated = std::move(handler); }
  // Nothing is ever called on a client.
  void setRemoteObjectInterface(std::shared_ptr<const InterfaceDescription>) override {}
  void resume() override { resumed = true; }

  bool isServed() const { return resumed && description && object; }

  void call(std::size_t operation, List arguments, BusCompletion completion) override {
    description->operations.at(operation).call(
        *object, arguments, [completion = std::move(completion)](OperationReply reply) {
          if (auto* results = std::get_if<List>(&reply)) return completion(std::move(*results));
          completion(BusError{"com.kestrel.hearth.Failed", std::get<std::error_code>(reply).message()});
        });
  }
  void closed() override {
    object.reset();
    if (const auto handler = std::exchange(invalidated, nullptr)) handler();
  }

 private:
  Entitlements& source;
  const PeerIdentity peer;
  std::optional<Dictionary> entitlements;
  std::shared_ptr<const InterfaceDescription> description;
  std::shared_ptr<RadixUserControllerInterface> object;
  std::function<void()> invalidated;
  bool resumed = false;
};

}  // namespace

BusInterface clientInterface(std::string_view serviceName) {
  const auto description = RadixUserControllerConduitInterface();
  BusInterface interface {
    "/" + std::string(serviceName), std::string(description->name), {}, {}
  };
  std::replace(interface.path.begin(), interface.path.end(), '.', '/');
  for (const OperationDescription& operation : description->operations) {
    interface.operations.push_back(
        {std::string(operation.name), std::string(operation.arguments), std::string(operation.results)});
  }
  return interface;
}

std::shared_ptr<BusServiceListener> BusServiceListener::create(EventLoop& io, Entitlements& entitlements,
                                                               std::string_view serviceName,
                                                               UniqueDescriptor socket) {
  return std::shared_ptr<BusServiceListener>(
      new BusServiceListener(io, entitlements, serviceName, std::move(socket)));
}

BusServiceListener::BusServiceListener(EventLoop& io_, Entitlements& entitlements_,
                                       std::string_view serviceName, UniqueDescriptor socket_)
    : io(io_),
      entitlements(entitlements_),
      socket(std::move(socket_)),
      server(std::make_unique<BusServer>(clientInterface(serviceName))) {}

BusServiceListener::~BusServiceListener() {
  // Ended where they are used.
  io.async([ended = std::shared_ptr<BusServer>(std::move(server)),
            watched = std::make_shared<EventSource>(std::move(watch))] { *watched = EventSource(); });
}

void BusServiceListener::setDelegate(std::weak_ptr<ServiceListenerDelegate> next) {
  delegate = std::move(next);
}

void BusServiceListener::setQueue(std::shared_ptr<WorkQueue> next) { queue = std::move(next); }

void BusServiceListener::resume() {
  io.async([weak = weak_from_this()] {
    const auto self = weak.lock();
    if (!self || !self->socket) return;
    BusServer& running = *self->server;
    running.listen(std::move(self->socket), [weak](PeerIdentity peer, BusServer::Decide decide) {
      if (const auto live = weak.lock()) live->admit(peer, std::move(decide));
    });
    self->watch = self->io.watchDescriptor(running.descriptor(), EPOLLIN,
                                           [&running](std::uint32_t) { running.dispatch(); });
  });
}

// The peer is offered on the listener's queue, whatever could be established of it.
void BusServiceListener::admit(const PeerIdentity& peer, BusServer::Decide decide) {
  const auto connection = std::make_shared<BusClientConnection>(entitlements, peer);
  queue->async([self = shared_from_this(), connection, decide = std::move(decide)] {
    const auto judge = self->delegate.lock();
    const bool accepted = judge && judge->listenerShouldAcceptNewConnection(self, connection);
    decide({accepted && connection->isServed() ? connection : nullptr, nullptr});
  });
}

void BusServiceListener::invalidate() {
  io.async([weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->server->stopListening();
  });
}

void BusServiceListener::drain(std::function<void()> drained) {
  io.async([self = shared_from_this(), drained = std::move(drained)] { self->server->drain(drained); });
}

}  // namespace platform::linux_
