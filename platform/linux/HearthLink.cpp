#include "platform/linux/HearthLink.hpp"

#include <map>
#include <tuple>
#include <utility>

#include "platform/LogSink.hpp"
#include "platform/linux/AsyncBusClient.hpp"
#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/InheritedDescriptors.hpp"

namespace platform::linux_ {
namespace {

void logError(const BusReply& reply, const BusOperation& operation) {
  if (const auto* error = std::get_if<BusError>(&reply)) {
    hearthLog("link").error("%s: %s: %s", operation.name, error->name, error->message);
  }
}

}  // namespace

// What several threads touch. Calls are handed to the loop while `mutex` is held, so that they leave in the
// order in which the registrations changed; no handler is called, or destroyed, under it.
class HearthLink::State : public std::enable_shared_from_this<State> {
 public:
  State(EventLoop& io_, std::shared_ptr<WorkQueue> mainQueue_, std::function<void()> lost_)
      : io(io_), mainQueue(std::move(mainQueue_)), lost(std::move(lost_)) {}

  void open(UniqueDescriptor socket) {
    auto shared =
        std::make_shared<UniqueDescriptor>(std::move(socket));  // work is copied, a descriptor is not
    io.async([weak = weak_from_this(), shared] {
      auto self = weak.lock();
      if (!self) return;
      self->client = std::make_unique<AsyncBusClient>(
          self->io, std::move(*shared), hearthInterface(),
          [weak](std::size_t signal, const List& arguments) {
            if (auto live = weak.lock()) live->received(signal, arguments);
          },
          self->lost);
    });
  }

  // The connection is the loop's thread's to close.
  void close() {
    std::map<std::string, StreamHandler, std::less<>> oldHandlers;
    std::map<std::int32_t, std::shared_ptr<Registration>> oldRegistrations;
    std::lock_guard lock(mutex);
    oldHandlers.swap(handlers);
    oldRegistrations.swap(registrations);
    io.async([self = shared_from_this()] { self->client.reset(); });
  }

  void send(HearthOperation operation, List arguments,
            std::function<void(const BusReply&)> answered = nullptr) {
    io.async([weak = weak_from_this(), operation, arguments = std::move(arguments),
              answered = std::move(answered)] {
      auto self = weak.lock();
      if (!self || !self->client) return;
      const auto index = static_cast<std::size_t>(operation);
      self->client->call(index, arguments, [index, answered](const BusReply& reply) {
        logError(reply, hearthInterface().operations[index]);
        if (answered) answered(reply);
      });
    });
  }

  void setHandler(std::string stream, std::shared_ptr<WorkQueue> queue, EventStreams::Handler handler) {
    StreamHandler old;
    std::lock_guard lock(mutex);
    StreamHandler& place = handlers[stream];
    old =
        std::exchange(place, {std::move(queue), std::make_shared<EventStreams::Handler>(std::move(handler))});
    send(HearthOperation::installHandler, {std::move(stream)});
  }

  void setEvent(std::string stream, std::string name, std::optional<Date> date) {
    std::lock_guard lock(mutex);
    const EventKey key{stream, name, false};
    Event& event = events[key];
    ++event.unanswered;
    event.pending.reset();  // came before this call, so it is stale
    const auto answered = [weak = weak_from_this(), key](const BusReply& reply) {
      auto self = weak.lock();
      if (self) self->eventSet(key, reply);
    };
    if (date) {
      send(HearthOperation::setEvent, {std::move(stream), std::move(name), date->nanoseconds}, answered);
    } else {
      send(HearthOperation::clearEvent, {std::move(stream), std::move(name)}, answered);
    }
  }

  void registerHandler(std::string name, std::int32_t& token, std::shared_ptr<WorkQueue> queue,
                       NamedNotifications::Handler handler) {
    std::lock_guard lock(mutex);
    token = ++lastToken;
    registrations[token] =
        std::make_shared<Registration>(Registration{name, token, std::move(queue), std::move(handler)});
    send(HearthOperation::watch, {std::move(name)});
  }

  void cancel(std::int32_t token) {
    std::shared_ptr<Registration> old;
    std::lock_guard lock(mutex);
    const auto found = registrations.find(token);
    if (found == registrations.end()) return;
    old = std::move(found->second);
    registrations.erase(found);
    for (const auto& [other, registration] : registrations) {
      if (registration->name == old->name) return;
    }
    send(HearthOperation::unwatch, {old->name});
  }

 private:
  struct StreamHandler {
    std::shared_ptr<WorkQueue> queue;
    std::shared_ptr<EventStreams::Handler> handler;
  };
  struct Registration {
    std::string name;
    std::int32_t token;
    std::shared_ptr<WorkQueue> queue;
    NamedNotifications::Handler handler;
    bool queued = false;
  };
  // Stream, name, and whether it is no alarm's: those must not take the place of an alarm, whose "taken"
  // counts.
  using EventKey = std::tuple<std::string, std::string, bool>;
  struct Event {
    int unanswered = 0;           // registrations of which hearthd has not told the generation yet
    std::int64_t leastValid = 0;  // older generations were replaced or cleared
    std::optional<std::int64_t> pending;
  };

  void received(std::size_t signal, const List& arguments) {
    const std::string& first = *arguments[0].as<std::string>();
    std::lock_guard lock(mutex);
    if (static_cast<HearthSignal>(signal) == HearthSignal::notification) return queueNotification(first);
    const std::int64_t generation = *arguments[2].as<std::int64_t>();
    const EventKey key{first, *arguments[1].as<std::string>(), generation == 0};
    Event& event = events[key];
    if (generation < event.leastValid) return;
    if (generation == 0 && event.pending) return;  // merges with the one that waits
    event.pending = generation;
    if (event.unanswered == 0) queueEvent(key, generation);
  }

  void queueNotification(const std::string& name) {
    for (const auto& [token, registration] : registrations) {
      if (registration->name != name || registration->queued) continue;
      registration->queued = true;
      registration->queue->async([weak = weak_from_this(), registration = registration] {
        auto self = weak.lock();
        if (!self) return;
        {
          std::lock_guard lock(self->mutex);
          registration->queued = false;
          const bool isCancelled = !self->registrations.contains(registration->token);
          if (isCancelled && registration->queue == self->mainQueue) return;
        }
        registration->handler(registration->token);
      });
    }
  }

  // An event that came while a registration of its name was unanswered is of the old one or of the new one;
  // the answer tells.
  void eventSet(const EventKey& key, const BusReply& reply) {
    std::lock_guard lock(mutex);
    Event& event = events[key];
    --event.unanswered;
    if (const auto* results = std::get_if<List>(&reply)) event.leastValid = *(*results)[0].as<std::int64_t>();
    if (!event.pending || event.unanswered > 0) return;
    if (*event.pending < event.leastValid) {
      event.pending.reset();
    } else {
      queueEvent(key, *event.pending);
    }
  }

  void queueEvent(const EventKey& key, std::int64_t generation) {
    const auto found = handlers.find(std::get<0>(key));
    if (found == handlers.end()) return;
    found->second.queue->async([weak = weak_from_this(), key, generation] {
      if (auto self = weak.lock()) self->handle(key, generation);
    });
  }

  void handle(const EventKey& key, std::int64_t generation) {
    const auto& [stream, name, byHand] = key;
    std::shared_ptr<EventStreams::Handler> handler;
    {
      std::lock_guard lock(mutex);
      Event& event = events[key];
      if (event.pending != generation) return;  // replaced or cleared since it was queued
      event.pending.reset();
      const auto found = handlers.find(stream);
      if (found == handlers.end()) return;
      handler = found->second.handler;
    }
    (*handler)({{std::string(nameKey), name}});
    if (!byHand) send(HearthOperation::taken, {stream, name, generation});
  }

  EventLoop& io;
  const std::shared_ptr<WorkQueue> mainQueue;
  const std::function<void()> lost;
  std::unique_ptr<AsyncBusClient> client;  // the loop's thread's

  std::mutex mutex;  // guards everything below
  std::int32_t lastToken = 0;
  std::map<std::int32_t, std::shared_ptr<Registration>> registrations;
  std::map<std::string, StreamHandler, std::less<>> handlers;
  std::map<EventKey, Event> events;
};

Result<std::unique_ptr<HearthLink>> HearthLink::inherit(EventLoop& io, std::shared_ptr<WorkQueue> mainQueue,
                                                        std::function<void()> lost) {
  UniqueDescriptor socket = takeInheritedDescriptor(linkDescriptorName);
  if (!socket) return Outcome::notConnected;
  return std::make_unique<HearthLink>(io, std::move(socket), std::move(mainQueue), std::move(lost));
}

HearthLink::HearthLink(EventLoop& io_, UniqueDescriptor socket, std::shared_ptr<WorkQueue> mainQueue_,
                       std::function<void()> lost_)
    : mainQueue(std::move(mainQueue_)), state(std::make_shared<State>(io_, mainQueue, std::move(lost_))) {
  state->open(std::move(socket));
}

HearthLink::~HearthLink() { state->close(); }

void HearthLink::setHandler(std::string_view stream, std::shared_ptr<WorkQueue> queue,
                            EventStreams::Handler handler) {
  state->setHandler(std::string(stream), std::move(queue), std::move(handler));
}

void HearthLink::setEvent(std::string_view stream, std::string_view name,
                          const std::optional<Dictionary>& descriptor) {
  if (!descriptor) return state->setEvent(std::string(stream), std::string(name), std::nullopt);
  const Date* date = find<Date>(*descriptor, "Date");
  if (!date) {
    hearthLog("link").error("event %s of %s refused: no usable date in %s", name, stream,
                            [&] { return describe(*descriptor); });
    return;
  }
  state->setEvent(std::string(stream), std::string(name), *date);
}

void HearthLink::post(std::string_view name) { state->send(HearthOperation::post, {name}); }

std::uint32_t HearthLink::registerHandler(std::string_view name, std::int32_t& token,
                                          std::shared_ptr<WorkQueue> queue,
                                          NamedNotifications::Handler handler) {
  state->registerHandler(std::string(name), token, std::move(queue), std::move(handler));
  return 0;
}

void HearthLink::cancel(std::int32_t token) { state->cancel(token); }

void HearthLink::addObserver(std::weak_ptr<void> observer, Callback callback, std::string_view name) {
  const void* address = observer.lock().get();
  std::int32_t token = -1;
  registerHandler(name, token, mainQueue, [observer, callback, text = std::string(name)](std::int32_t) {
    if (auto live = observer.lock()) callback(live, text);
  });
  std::lock_guard lock(mutex);
  observations.push_back({address, std::string(name), token});
}

void HearthLink::removeObserver(const void* observer, std::string_view name) {
  std::lock_guard lock(mutex);
  std::erase_if(observations, [&](const Observation& observation) {
    if (observation.observer != observer || observation.name != name) return false;
    cancel(observation.token);
    return true;
  });
}

}  // namespace platform::linux_
