// Named notifications and event streams, without a service manager behind them.
#pragma once

#include "platform/EventStreams.hpp"
#include "platform/NamedNotifications.hpp"
#include "tests/fakes/FakeEnvironment.hpp"

namespace fakes {

class FakeNamedNotifications : public NamedNotifications, public NamedNotificationCentre {
 public:
  FakeNamedNotifications(Effects& effects_, std::shared_ptr<ManualPool> mainQueue_)
      : effects(effects_), mainQueue(std::move(mainQueue_)) {}

  // The common start of names is not recorded.
  void post(std::string_view name) override {
    effects.record(Effects::post,
                   "post " + std::string(name.substr(std::string_view("com.kestrel.").size())));
    postFromElsewhere(name);
  }
  // Another process posts.
  void postFromElsewhere(std::string_view name) {
    std::lock_guard lock(mutex);
    for (const auto& [token, registration] : registrations) {
      if (registration->name != name || std::exchange(registration->pending, true)) continue;
      registration->queue->async([this, registration = registration, token = token] {
        if (take(token, *registration)) registration->handler(token);
      });
    }
  }
  std::uint32_t registerHandler(std::string_view name, std::int32_t& token, std::shared_ptr<WorkQueue> queue,
                                Handler handler) override {
    std::lock_guard lock(mutex);
    token = ++lastToken;
    registrations[token] = std::make_shared<Registration>(
        Registration{std::string(name), std::move(queue), std::move(handler), false});
    return 0;
  }
  void cancel(std::int32_t token) override {
    std::lock_guard lock(mutex);
    cancelled.push_back(token);
    registrations.erase(token);
  }

  void addObserver(std::weak_ptr<void> observer, Callback callback, std::string_view name) override {
    const auto call = [observer, callback, text = std::string(name)](std::int32_t) {
      if (const auto live = observer.lock()) callback(live, text);
    };
    registerHandler(name, observers[{observer.lock().get(), std::string(name)}], mainQueue, call);
  }
  void removeObserver(const void* observer, std::string_view name) override {
    cancel(observers[{observer, std::string(name)}]);
  }

  struct Registration {
    std::string name;
    std::shared_ptr<WorkQueue> queue;
    Handler handler;
    bool pending;
  };
  std::map<std::int32_t, std::shared_ptr<Registration>> registrations;
  std::vector<std::int32_t> cancelled;

 private:
  bool take(std::int32_t token, Registration& registration) {
    std::lock_guard lock(mutex);
    registration.pending = false;
    return registrations.contains(token) || registration.queue != mainQueue;
  }

  Effects& effects;
  const std::shared_ptr<ManualPool> mainQueue;
  std::map<std::pair<const void*, std::string>, std::int32_t> observers;  // their tokens
  std::mutex mutex;                                                       // guards the registrations
  std::int32_t lastToken = 0;
};

// Alarms of any stream; they come due as FakePlatform::advance() moves the clock. Unlike the service manager
// it delivers what is overdue at once, and keeps alarms only as long as it lives.
class FakeEventStreams : public EventStreams {
 public:
  explicit FakeEventStreams(Effects& effects_) : effects(effects_) {}

  void setHandler(std::string_view stream, std::shared_ptr<WorkQueue> queue, Handler handler) override {
    handlers[std::string(stream)] =
        std::make_shared<Installed>(Installed{std::move(queue), std::move(handler)});
  }
  void setEvent(std::string_view stream, std::string_view name,
                const std::optional<Dictionary>& descriptor) override {
    if (isCut && isCut()) return;
    const std::string text = Effects::shortKey(name) == "flag" ? "alarm" : "alarm " + std::string(name);
    alarms.erase({std::string(stream), std::string(name)});
    if (!descriptor) return effects.record(Effects::alarm, text + " cleared");
    const std::int64_t due = descriptor->at("Date").as<Date>()->nanoseconds;
    alarms[{std::string(stream), std::string(name)}] = {due, ++lastGeneration, false};
    effects.record(Effects::alarm, text + " at " + std::to_string(due) + " ns");
  }

  void deliver(std::string_view stream, const Dictionary& event) {
    const auto installed = handlers.find(stream)->second;
    installed->queue->async([installed, event] { installed->handler(event); });
  }
  // When the next alarm comes due that is not on its way yet.
  std::optional<Time> nextDue() const {
    std::optional<Time> next;
    for (const auto& [key, alarm] : alarms) {
      if (!alarm.sent && handlers.contains(key.first) && (!next || alarm.due() < *next)) next = alarm.due();
    }
    return next;
  }
  // An alarm goes when its handler has returned, unless it was set anew; replaced or cleared before its event
  // was handled, it does not come.
  void deliverDue(Time now) {
    for (auto& [key, alarm] : alarms) {
      const auto found = handlers.find(key.first);
      if (alarm.sent || alarm.due() > now || found == handlers.end()) continue;
      alarm.sent = true;
      found->second->queue->async([this, installed = found->second, key = key,
                                   generation = alarm.generation] {
        const auto isCurrent = [&] { return alarms.contains(key) && alarms[key].generation == generation; };
        if (!isCurrent()) return;
        installed->handler({{std::string(nameKey), key.second}});
        if (isCurrent()) alarms.erase(key);
      });
    }
  }

  using Key = std::pair<std::string, std::string>;  // stream, name
  struct Alarm {
    std::int64_t nanoseconds;
    std::uint64_t generation;
    bool sent;
    Time due() const { return Time(static_cast<double>(nanoseconds) / 1e9); }
  };
  struct Installed {
    std::shared_ptr<WorkQueue> queue;
    Handler handler;
  };
  std::map<Key, Alarm> alarms;
  std::function<bool()> isCut;  // whether the process's calls reach nobody any more
  std::map<std::string, std::shared_ptr<Installed>, std::less<>> handlers;

 private:
  Effects& effects;
  std::uint64_t lastGeneration = 0;
};

}  // namespace fakes
