// The three key-value stores behind the daemon's settings.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Result.hpp"
#include "platform/Value.hpp"

namespace platform {

class KeyObserver {
 public:
  virtual ~KeyObserver() = default;
  // A value at `keyPath` of `object`, the store, has changed; old and new values are not delivered, and
  // there is no context.
  virtual void observeValue(const std::optional<std::string>& keyPath, const void* object) = 0;
};

// Any thread. Absent keys, and values that do not convert exactly, read as false, 0.0 or nothing.
class KeyValueStore {
 public:
  virtual ~KeyValueStore() = default;

  bool boolForKey(std::string_view key) {
    const auto value = read(key);
    return value && toBool(*value).value_or(false);
  }
  double doubleForKey(std::string_view key) {
    const auto value = read(key);
    return value ? toDouble(*value).value_or(0.0) : 0.0;
  }
  std::optional<std::string> textForKey(std::string_view key) {
    const auto value = read(key);
    return value ? toText(*value) : std::nullopt;
  }
  // No value removes the key. Failures are logged by the store; what was stored before then stays.
  virtual void setValue(const std::optional<Value>& value, std::string_view key) = 0;

  // Observers are held weakly. Removing what is not there is harmless.
  virtual void addObserver(std::weak_ptr<KeyObserver> observer, std::string_view key) = 0;
  virtual void removeObserver(const KeyObserver* observer, std::string_view key) = 0;

 private:
  // What is stored; the typed reads convert it.
  virtual std::optional<Value> read(std::string_view key) = 0;
};

// The process's own preferences. An own write calls the key's observers on the writer's thread before it
// returns; a write from elsewhere calls them on the delivery thread.
class UserPreferences : public KeyValueStore {};

// Shared by the user's devices. It fires no key observation: each change would otherwise also be taken for
// one of the user preferences. A change made outside the process posts `externalChangeNotification` on the
// in-process centre, from the delivery thread, with the store itself as sender.
class CloudStore : public KeyValueStore {
 public:
  static constexpr std::string_view externalChangeNotification =
      "com.kestrel.hearth.cloudStore.externalChange";
  // Entries of the user information.
  static constexpr std::string_view changeReasonKey = "ChangeReason";
  static constexpr std::string_view changedKeysKey = "ChangedKeys";
  enum class ChangeReason { serverChange, initialSync, quotaViolation, accountChange };

  // Whether the last write is durable.
  virtual bool synchronise() = 0;
  virtual Dictionary dictionaryRepresentation() = 0;
};

// The Bluetooth stack's root preferences. Any thread.
class RadixController {
 public:
  virtual ~RadixController() = default;
  // The keys of `keys` that are stored, with their values.
  virtual Result<Dictionary> readPrefKeys(const std::vector<std::string>& keys) = 0;
  // Null removes the key.
  virtual Result<void> writePrefKey(std::string_view key, const Value& value) = 0;
};

}  // namespace platform
