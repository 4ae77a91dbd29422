// The handle that a publisher gives to each subscriber.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <system_error>
#include <utility>

#include "platform/Platform.hpp"
#include "platform/Result.hpp"
#include "platform/UUID.hpp"

namespace pairwell {

// An immutable value: copies stand for the same subscription, and dropping one undoes nothing. It holds its
// subscriber, so a publisher's list keeps the subscriber alive. Any thread.
template <class Subscriber>
class Subscription {
 public:
  // Called on a shared queue with the handle to remove.
  using UnsubscribeBlock = std::function<platform::Result<void>(const Subscription&)>;

  // For publishers.
  Subscription(std::shared_ptr<Subscriber> subscriber_, UnsubscribeBlock unsubscribeBlock_)
      : _subscriber(std::move(subscriber_)),
        identifier(platform::UUID::random()),
        unsubscribeBlock(std::move(unsubscribeBlock_)) {}

  const std::shared_ptr<Subscriber>& subscriber() const { return _subscriber; }

  // Returns at once. `completion` is called exactly once, on a shared queue, possibly before the publisher
  // has dropped its entry: an event under way may still arrive.
  void unsubscribe(std::function<void(std::optional<std::error_code>)> completion) const {
    platform::current()
        .queues()
        .global(platform::QualityOfService::default_)
        ->async([handle = *this, completion = std::move(completion)] {
          const auto result = handle.unsubscribeBlock(handle);
          completion(result ? std::nullopt : std::optional(result.error()));
        });
  }

  friend bool operator==(const Subscription& a, const Subscription& b) {
    return a.identifier == b.identifier;
  }

 private:
  std::shared_ptr<Subscriber>
      _subscriber;  // read through subscriber(): a list assigns handles, others do not
  platform::UUID identifier;
  UnsubscribeBlock unsubscribeBlock;
};

}  // namespace pairwell
