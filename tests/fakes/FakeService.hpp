// The client service, with clients that a test makes up.
#pragma once

#include "platform/ServiceListener.hpp"
#include "tests/fakes/FakeEnvironment.hpp"

namespace fakes {

class FakeClientConnection : public ClientConnection {
 public:
  FakeClientConnection(Effects& effects_, std::int32_t process_, Dictionary entitlements_)
      : effects(effects_), process(process_), entitlements(std::move(entitlements_)) {}

  std::int32_t processIdentifier() const override { return process; }
  std::optional<Value> valueForEntitlement(std::string_view name) override {
    const auto found = entitlements.find(name);
    return found == entitlements.end() ? std::nullopt : std::optional(found->second);
  }
  void setExportedInterface(std::shared_ptr<const InterfaceDescription>) override {
    effects.record(Effects::client, "exported interface");
  }
  void setExportedObject(std::shared_ptr<RadixUserControllerInterface> object) override {
    exportedObject = std::move(object);
    effects.record(Effects::client, "exported object");
  }
  void setInvalidationHandler(std::function<void()> handler) override {
    invalidationHandler = std::move(handler);
    effects.record(Effects::client, "invalidation handler");
  }
  void setRemoteObjectInterface(std::shared_ptr<const InterfaceDescription>) override {
    effects.record(Effects::client, "remote interface");
  }
  void resume() override { effects.record(Effects::client, "resumed"); }

  // The client goes. Runs the handler at once, on the caller's thread, and then lets go of what was held.
  void end() {
    const auto object = std::exchange(exportedObject, nullptr);
    if (const auto handler = std::exchange(invalidationHandler, nullptr)) handler();
  }

  std::shared_ptr<RadixUserControllerInterface> exportedObject;
  std::optional<bool> admitted;

 private:
  Effects& effects;
  const std::int32_t process;
  const Dictionary entitlements;
  std::function<void()> invalidationHandler;
};

struct FakeServiceListener : ServiceListener, std::enable_shared_from_this<FakeServiceListener> {
  void setDelegate(std::weak_ptr<ServiceListenerDelegate> newDelegate) override {
    delegate = std::move(newDelegate);
  }
  void setQueue(std::shared_ptr<WorkQueue> newQueue) override { queue = std::move(newQueue); }
  void resume() override { resumed = true; }
  void invalidate() override { invalidated = true; }

  // A client comes. One that comes after invalidate() is left without an answer.
  void offer(std::shared_ptr<FakeClientConnection> connection) {
    if (invalidated || !resumed) return;
    queue->async([self = shared_from_this(), connection = std::move(connection)] {
      const auto decider = self->delegate.lock();
      connection->admitted = decider && decider->listenerShouldAcceptNewConnection(self, connection);
      if (*connection->admitted) self->clients.push_back(connection);
    });
  }

  std::shared_ptr<WorkQueue> queue;
  std::weak_ptr<ServiceListenerDelegate> delegate;
  std::vector<std::shared_ptr<FakeClientConnection>> clients;
  bool resumed = false, invalidated = false;
};

}  // namespace fakes
