// The three stores, in memory. Any write fails, and leaves what was there, once a test says so.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <system_error>
#include <utility>
#include <vector>

#include "platform/NotificationCentre.hpp"
#include "platform/Stores.hpp"
#include "tests/fakes/Effects.hpp"
#include "tests/fakes/ManualPool.hpp"

namespace fakes {

// What the cloud and user stores share. Unlike a real store it is not made for several threads at once.
template <class Interface>
class FakeKeyValueStore : public Interface {
 public:
  FakeKeyValueStore(std::string name_, Effects& effects_) : effects(effects_), name(std::move(name_)) {}

  bool boolForKey(std::string_view key) override { return converted(key, platform::toBool).value_or(false); }
  double doubleForKey(std::string_view key) override {
    return converted(key, platform::toDouble).value_or(0.0);
  }
  std::optional<std::string> textForKey(std::string_view key) override {
    return converted(key, platform::toText);
  }
  void setValue(const std::optional<platform::Value>& value, std::string_view key) override {
    if (!failing) store(key, value);
    effects.record(Effects::store, name + " " + Effects::shortKey(key) + "=" + platform::describe(value) +
                                       (failing ? " failed" : ""));
  }
  void addObserver(std::weak_ptr<platform::KeyObserver> observer, std::string_view key) override {
    const platform::KeyObserver* address = observer.lock().get();
    observers.push_back({std::move(observer), address, std::string(key)});
  }
  void removeObserver(const platform::KeyObserver* observer, std::string_view key) override {
    std::erase_if(observers,
                  [&](const auto& entry) { return entry.address == observer && entry.key == key; });
  }

  // Puts a value there as if it had always been: no effect, no observer.
  void store(std::string_view key, const std::optional<platform::Value>& value) {
    if (value) {
      contents.insert_or_assign(std::string(key), *value);
    } else if (const auto found = contents.find(key); found != contents.end()) {
      contents.erase(found);
    }
  }
  std::optional<platform::Value> value(std::string_view key) const {
    const auto found = contents.find(key);
    return found == contents.end() ? std::nullopt : std::optional(found->second);
  }

  struct Observation {
    std::weak_ptr<platform::KeyObserver> observer;
    const platform::KeyObserver* address;
    std::string key;
  };
  platform::Dictionary contents;
  std::vector<Observation> observers;
  bool failing = false;

 protected:
  Effects& effects;

 private:
  template <class Convert>
  auto converted(std::string_view key, Convert convert) {
    const auto found = value(key);
    effects.moment();
    return found ? convert(*found) : std::nullopt;
  }

  const std::string name;
};

class FakeUserPreferences : public FakeKeyValueStore<platform::UserPreferences> {
 public:
  FakeUserPreferences(Effects& recorder, std::shared_ptr<ManualPool> delivery_)
      : FakeKeyValueStore("user", recorder), delivery(std::move(delivery_)) {}

  void setValue(const std::optional<platform::Value>& newValue, std::string_view key) override {
    FakeKeyValueStore::setValue(newValue, key);
    if (!failing) report(std::string(key));
  }
  // Another process writes. Observers hear of it on the delivery thread.
  void changeFromElsewhere(std::string_view key, const std::optional<platform::Value>& newValue) {
    store(key, newValue);
    delivery->async([this, key = std::string(key)] { report(key); });
  }

 private:
  void report(const std::string& key) {
    const auto snapshot = observers;
    for (const Observation& entry : snapshot) {
      if (entry.key != key) continue;
      if (const auto observer = entry.observer.lock()) observer->observeValue(key, this);
    }
  }

  const std::shared_ptr<ManualPool> delivery;
};

class FakeCloudStore : public FakeKeyValueStore<platform::CloudStore> {
 public:
  FakeCloudStore(Effects& recorder, std::shared_ptr<ManualPool> delivery_,
                 platform::NotificationCentre& centre_)
      : FakeKeyValueStore("cloud", recorder), delivery(std::move(delivery_)), centre(centre_) {}

  bool synchronise() override { return !failing; }
  platform::Dictionary dictionaryRepresentation() override {
    ++representations;
    return contents;
  }

  // Another device writes.
  void changeFromElsewhere(const platform::Dictionary& changes) {
    platform::List keys;
    for (const auto& [key, newValue] : changes) {
      store(key, newValue == platform::Value() ? std::nullopt : std::optional(newValue));
      keys.emplace_back(key);
    }
    announce(platform::Dictionary{{std::string(changeReasonKey), 0}, {std::string(changedKeysKey), keys}});
  }
  void announce(std::optional<platform::Dictionary> userInfo) {
    delivery->async([this, userInfo = std::move(userInfo)] {
      centre.post(externalChangeNotification, static_cast<platform::CloudStore*>(this), userInfo);
    });
  }

  int representations = 0;

 private:
  const std::shared_ptr<ManualPool> delivery;
  platform::NotificationCentre& centre;
};

class FakeRadixController : public platform::RadixController {
 public:
  explicit FakeRadixController(Effects& effects_) : effects(effects_) {}

  platform::Result<platform::Dictionary> readPrefKeys(const std::vector<std::string>& keys) override {
    if (failure) return failure;
    platform::Dictionary found;
    for (const auto& [key, value] : contents) {
      if (std::find(keys.begin(), keys.end(), key) != keys.end()) found.emplace(key, value);
    }
    return found;
  }
  platform::Result<void> writePrefKey(std::string_view key, const platform::Value& value) override {
    if (!failure) {
      contents.erase(std::string(key));
      if (!(value == platform::Value())) contents.emplace(key, value);
    }
    effects.record(Effects::store, "root " + Effects::shortKey(key) + "=" + platform::describe(value) +
                                       (failure ? " failed" : ""));
    return failure;
  }

  platform::Dictionary contents;
  std::error_code failure;

 private:
  Effects& effects;
};

}  // namespace fakes
