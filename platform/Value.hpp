// Property values: what stores, descriptors, entitlements and notifications carry.
#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace platform {

// A moment as the daemon computes with it: seconds since 1970-01-01 00:00:00 UTC, fraction included. A
// double, since integral ticks overflow at what a store may hold.
using Time = std::chrono::duration<double>;

// A moment as a property value: nanoseconds since 1970-01-01 00:00:00 UTC, as alarm descriptors count.
struct Date {
  std::int64_t nanoseconds = 0;
  // In whole seconds, the fraction dropped. Absent for what is not finite or lies outside
  // -9223372036…9223372036, some 292 years around 1970: a clamped one is a moment that nobody meant.
  static std::optional<Date> ofSeconds(double secondsSince1970);
  friend bool operator==(const Date&, const Date&) = default;
};

struct Value;
using List = std::vector<Value>;
using Dictionary = std::map<std::string, Value, std::less<>>;

// Null is a value of its own (root preferences store it); absence is std::optional's.
struct Value {
  using Storage =
      std::variant<std::nullptr_t, bool, std::int64_t, double, std::string, Date, List, Dictionary>;

  Value(std::nullptr_t = nullptr) : storage(nullptr) {}
  Value(bool value) : storage(value) {}
  Value(int value) : storage(std::int64_t{value}) {}
  Value(std::int64_t value) : storage(value) {}
  Value(double value) : storage(value) {}
  Value(const char* value) : storage(std::string(value)) {}
  Value(std::string value) : storage(std::move(value)) {}
  Value(std::string_view value) : storage(std::string(value)) {}
  Value(Date value) : storage(value) {}
  Value(List value) : storage(std::move(value)) {}
  Value(Dictionary value) : storage(std::move(value)) {}

  // The alternative itself, or nullptr: no conversion.
  template <class T>
  const T* as() const {
    return std::get_if<T>(&storage);
  }

  friend bool operator==(const Value&, const Value&);

  Storage storage;
};

// The entry of `key`, or nullptr; the second, only one of that alternative.
inline const Value* find(const Dictionary& dictionary, std::string_view key) {
  const auto found = dictionary.find(key);
  return found == dictionary.end() ? nullptr : &found->second;
}
template <class T>
const T* find(const Dictionary& dictionary, std::string_view key) {
  const Value* value = find(dictionary, key);
  return value ? value->as<T>() : nullptr;
}
// A copy of it.
inline std::optional<Value> valueOf(const Dictionary& dictionary, std::string_view key) {
  const Value* value = find(dictionary, key);
  return value ? std::optional(*value) : std::nullopt;
}

// Numbers and booleans convert where that is exact (0 and 1, 5 and 5.0); everything else is absent.
std::optional<bool> toBool(const Value& value);
std::optional<std::int64_t> toInteger(const Value& value);
std::optional<double> toDouble(const Value& value);
// Text itself only.
std::optional<std::string> toText(const Value& value);
// A list of texts only; anything else in it makes the whole absent.
std::optional<std::vector<std::string>> toTexts(const Value& value);

// As log lines print values: booleans as words, doubles as the shortest decimal that reads back with a
// fraction and an exponent from 1e16 on, text bare but quoted inside a container, `null`, [a, b], [k: v] by
// key, [:].
std::string describe(const Value& value);
std::string describe(const Dictionary& dictionary);
std::string describe(double value);
// An absent value prints as nil.
std::string describe(const std::optional<Value>& value);

}  // namespace platform
