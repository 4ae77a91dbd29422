// What a publisher offers to its subscribers.
#pragma once

#include <concepts>
#include <memory>
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

}  // namespace pairwell
