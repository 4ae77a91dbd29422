// The client service, with clients that a test makes up.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/Platform.hpp"
#include "platform/ServiceListener.hpp"
#include "tests/fakes/Effects.hpp"

namespace fakes {

class FakeClientConnection : public platform::ClientConnection {
 public:
  FakeClientConnection(Effects& effects_, std::int32_t process_, platform::Dictionary entitlements_)
      : entitlements(std::move(entitlements_)), effects(effects_), process(process_) {}

  std::int32_t processIdentifier() const override { return process; }
  std::optional<platform::Value> valueForEntitlement(std::string_view name) override {
    lookedUp.emplace_back(name);
    const auto found = entitlements.find(name);
    return found == entitlements.end() ? std::nullopt : std::optional(found->second);
  }
  void setExportedInterface(std::shared_ptr<const platform::InterfaceDescription> description) override {
    exportedInterface = std::move(description);
    effects.record(Effects::client, "exported interface");
  }
  void setExportedObject(std::shared_ptr<platform::RadixUserControllerInterface> object) override {
    exportedObject = std::move(object);
    effects.record(Effects::client, "exported object");
  }
  void setInvalidationHandler(std::function<void()> handler) override {
    invalidationHandler = std::move(handler);
    effects.record(Effects::client, "invalidation handler");
  }
  void setRemoteObjectInterface(std::shared_ptr<const platform::InterfaceDescription> description) override {
    remoteInterface = std::move(description);
    effects.record(Effects::client, "remote interface");
  }
  void resume() override {
    resumed = true;
    effects.record(Effects::client, "resumed");
  }

  // The client goes. Runs the handler at once, on the caller's thread, and then lets go of what was held.
  void end() {
    const auto object = std::exchange(exportedObject, nullptr);
    if (const auto handler = std::exchange(invalidationHandler, nullptr)) handler();
  }

  platform::Dictionary entitlements;
  std::vector<std::string> lookedUp;
  std::shared_ptr<const platform::InterfaceDescription> exportedInterface;
  std::shared_ptr<const platform::InterfaceDescription> remoteInterface;
  std::shared_ptr<platform::RadixUserControllerInterface> exportedObject;
  std::function<void()> invalidationHandler;
  bool resumed = false;
  std::optional<bool> admitted;

 private:
  Effects& effects;
  const std::int32_t process;
};

class FakeServiceListener : public platform::ServiceListener,
                            public std::enable_shared_from_this<FakeServiceListener> {
 public:
  explicit FakeServiceListener(std::string_view serviceName_) : serviceName(serviceName_) {}

  void setDelegate(std::weak_ptr<platform::ServiceListenerDelegate> newDelegate) override {
    delegate = std::move(newDelegate);
  }
  void setQueue(std::shared_ptr<platform::WorkQueue> newQueue) override { queue = std::move(newQueue); }
  void resume() override {
    resumed = true;
    for (auto& connection : std::exchange(waiting, {})) offer(std::move(connection));
  }
  void invalidate() override { invalidated = true; }

  // A client comes. One that comes after invalidate() is left without an answer.
  void offer(std::shared_ptr<FakeClientConnection> connection) {
    if (invalidated) return;
    if (!resumed) return waiting.push_back(std::move(connection));
    queue->async([self = shared_from_this(), connection = std::move(connection)] {
      const auto decider = self->delegate.lock();
      connection->admitted = decider && decider->listenerShouldAcceptNewConnection(self, connection);
      if (*connection->admitted) self->clients.push_back(connection);
    });
  }

  const std::string serviceName;
  std::shared_ptr<platform::WorkQueue> queue;
  std::weak_ptr<platform::ServiceListenerDelegate> delegate;
  std::vector<std::shared_ptr<FakeClientConnection>> clients;
  bool resumed = false;
  bool invalidated = false;

 private:
  std::vector<std::shared_ptr<FakeClientConnection>> waiting;
};

}  // namespace fakes
