// The three stores, in memory. Any write fails, and leaves what was there, once a test says so. Reads and
// writes may come from several threads; what a test sees and sets directly is the test's.
#pragma once

#include <algorithm>
#include <system_error>

#include "platform/NotificationCentre.hpp"
#include "platform/Stores.hpp"
#include "tests/fakes/FakeEnvironment.hpp"

namespace fakes {

// What the cloud and user stores share.
template <class Interface>
class FakeKeyValueStore : public Interface {
 public:
  FakeKeyValueStore(std::string name_, Effects& effects_, std::shared_ptr<ManualPool> delivery_)
      : delivery(std::move(delivery_)), effects(effects_), name(std::move(name_)) {}

  void setValue(const std::optional<Value>& value, std::string_view key) override {
    if (!failing) store(key, value);
    effects.record(Effects::store,
                   name + " " + Effects::shortKey(key) + "=" + describe(value) + (failing ? " failed" : ""));
  }
  void addObserver(std::weak_ptr<KeyObserver> observer, std::string_view key) override {
    const KeyObserver* address = observer.lock().get();
    observers.push_back({std::move(observer), address, std::string(key)});
  }
  void removeObserver(const KeyObserver* observer, std::string_view key) override {
    std::erase_if(observers, [&](const auto& each) { return each.address == observer && each.key == key; });
  }

  // Puts a value there as if it had always been: no effect, no observer.
  void store(std::string_view key, const std::optional<Value>& value) {
    std::lock_guard lock(mutex);
    contents.erase(std::string(key));
    if (value) contents.emplace(key, *value);
  }
  std::optional<Value> value(std::string_view key) const {
    std::lock_guard lock(mutex);
    return valueOf(contents, key);
  }

  struct Observation {
    std::weak_ptr<KeyObserver> observer;
    const KeyObserver* address;
    std::string key;
  };
  Dictionary contents;
  std::vector<Observation> observers;
  bool failing = false;

 protected:
  const std::shared_ptr<ManualPool> delivery;

 private:
  std::optional<Value> read(std::string_view key) override {
    const auto found = value(key);
    effects.moment();
    return found;
  }

  Effects& effects;
  const std::string name;
  mutable std::mutex mutex;  // guards `contents`
};

class FakeUserPreferences : public FakeKeyValueStore<UserPreferences> {
 public:
  using FakeKeyValueStore::FakeKeyValueStore;

  void setValue(const std::optional<Value>& newValue, std::string_view key) override {
    FakeKeyValueStore::setValue(newValue, key);
    if (!failing) report(std::string(key));
  }
  // Another process writes. Observers hear of it on the delivery thread.
  void changeFromElsewhere(std::string_view key, const std::optional<Value>& newValue) {
    store(key, newValue);
    delivery->async([this, key = std::string(key)] { report(key); });
  }

 private:
  void report(const std::string& key) {
    for (const Observation& entry : std::vector(observers)) {
      const auto observer = entry.observer.lock();
      if (entry.key == key && observer) observer->observeValue(key, this);
    }
  }
};

class FakeCloudStore : public FakeKeyValueStore<CloudStore> {
 public:
  FakeCloudStore(Effects& recorder, std::shared_ptr<ManualPool> delivery_, NotificationCentre& centre_)
      : FakeKeyValueStore("cloud", recorder, std::move(delivery_)), centre(centre_) {}

  bool synchronise() override { return !failing; }
  Dictionary dictionaryRepresentation() override { return contents; }

  // Another device writes.
  void changeFromElsewhere(const Dictionary& changes) {
    List keys;
    for (const auto& [key, newValue] : changes) {
      store(key, newValue);
      keys.emplace_back(key);
    }
    announce(Dictionary{{std::string(changeReasonKey), 0}, {std::string(changedKeysKey), keys}});
  }
  void announce(std::optional<Dictionary> userInfo) {
    delivery->async([this, userInfo = std::move(userInfo)] {
      centre.post(externalChangeNotification, static_cast<CloudStore*>(this), userInfo);
    });
  }

 private:
  NotificationCentre& centre;
};

struct FakeRadixController : RadixController {
  explicit FakeRadixController(Effects& effects_) : effects(effects_) {}

  Result<Dictionary> readPrefKeys(const std::vector<std::string>& keys) override {
    if (failure) return failure;
    std::lock_guard lock(mutex);
    Dictionary found = contents;
    std::erase_if(found, [&](const auto& entry) { return std::ranges::count(keys, entry.first) == 0; });
    return found;
  }
  Result<void> writePrefKey(std::string_view key, const Value& value) override {
    if (!failure) {
      std::lock_guard lock(mutex);
      contents.erase(std::string(key));
      if (!(value == Value())) contents.emplace(key, value);
    }
    effects.record(Effects::store,
                   "root " + Effects::shortKey(key) + "=" + describe(value) + (failure ? " failed" : ""));
    return failure;
  }

  Dictionary contents;
  std::error_code failure;
  Effects& effects;
  std::mutex mutex;  // guards `contents`
};

}  // namespace fakes
