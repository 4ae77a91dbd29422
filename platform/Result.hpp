// A value, or the error that stands in its place.
#pragma once

#include <system_error>
#include <utility>
#include <variant>

namespace platform {

// Failures that a caller of the platform acts on; every other category of std::error_code is a fault of the
// system below, which callers pass on untouched.
enum class Outcome {
  malformedFile = 1,  // does not parse, or does not match its checksum: the file is moved aside
  notPermitted,       // refused by the other side's rules
  notConnected,       // the other side is not there
  timedOut,
  tooLarge,
};

std::error_code make_error_code(Outcome outcome);

// Named after std::expected, which C++20 does not have. `error()` may be asked only when there is no value.
template <class T>
class [[nodiscard]] Result {
 public:
  Result(T value) : state(std::in_place_index<0>, std::move(value)) {}
  Result(std::error_code error) : state(std::in_place_index<1>, error) {}
  Result(Outcome outcome) : Result(make_error_code(outcome)) {}

  bool has_value() const { return state.index() == 0; }
  explicit operator bool() const { return has_value(); }
  T& value() { return std::get<0>(state); }
  const T& value() const { return std::get<0>(state); }
  T& operator*() { return value(); }
  const T& operator*() const { return value(); }
  T* operator->() { return &value(); }
  const T* operator->() const { return &value(); }
  std::error_code error() const { return std::get<1>(state); }

 private:
  std::variant<T, std::error_code> state;
};

template <>
class [[nodiscard]] Result<void> {
 public:
  Result() = default;
  Result(std::error_code error) : failure(error) {}
  Result(Outcome outcome) : Result(make_error_code(outcome)) {}
  // Of one who only wants to know whether it worked.
  template <class T>
  Result(const Result<T>& other) : failure(other ? std::error_code() : other.error()) {}

  bool has_value() const { return !failure; }
  explicit operator bool() const { return has_value(); }
  std::error_code error() const { return failure; }

 private:
  std::error_code failure;
};

}  // namespace platform

template <>
struct std::is_error_code_enum<platform::Outcome> : std::true_type {};
