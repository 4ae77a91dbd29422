// What a publisher offers to its subscribers.
#pragma once

#include <concepts>
#include <functional>
#include <memory>
#include <optional>
#include <vector>

#include "pairwelld/notifications/Subscription.hpp"

namespace pairwell {

// subscribe() runs synchronously on the publisher's own serial queue, where `subscriptions`, in the order of
// subscribing, belongs; unsubscribing is queued there.
template <class Publisher>
concept Subscribable = requires(Publisher& publisher,
                                std::shared_ptr<typename Publisher::Subscriber> subscriber) {
  typename Publisher::Subscriber;
  { publisher.subscriptions } -> std::same_as<std::vector<Subscription<typename Publisher::Subscriber>>&>;
  { publisher.subscribe(subscriber) } -> std::same_as<Subscription<typename Publisher::Subscriber>>;
};

// What publishers have in common. The removal is queued, and needs a publisher only when its turn comes.
template <class Publisher>
void unsubscribeFrom(Publisher& publisher, const Subscription<typename Publisher::Subscriber>& subscription) {
  publisher.subscriptionQueue->async([weak = publisher.weak_from_this(), subscription] {
    const auto self = weak.lock();
    if (!self) return;
    self->subscriptionQueue->assertCurrent();
    std::erase(self->subscriptions, subscription);
  });
}

// `remove` is called with the publisher and the handle to take off its list.
template <class Publisher, class Remove>
Subscription<typename Publisher::Subscriber> subscribeTo(
    Publisher& publisher, const std::shared_ptr<typename Publisher::Subscriber>& subscriber, Remove remove) {
  using Handle = Subscription<typename Publisher::Subscriber>;
  std::optional<Handle> subscription;
  publisher.subscriptionQueue->sync([&] {
    publisher.subscriptionQueue->assertCurrent();
    subscription.emplace(
        subscriber,
        [weak = publisher.weak_from_this(), remove](const Handle& handle) -> platform::Result<void> {
          if (const auto self = weak.lock()) std::invoke(remove, *self, handle);
          return {};
        });
    publisher.subscriptions.push_back(*subscription);
  });
  return *subscription;
}

}  // namespace pairwell
