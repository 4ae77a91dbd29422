#include "platform/linux/BusValue.hpp"

#include <systemd/sd-bus.h>

#include <cstdint>
#include <string>
#include <utility>

namespace platform::linux_ {
namespace {

std::error_code failure(int result) { return {-result, std::system_category()}; }
std::error_code misfit() { return std::make_error_code(std::errc::invalid_argument); }

// The length of the complete type at the front of `signature`, which libraries have checked.
std::size_t completeType(std::string_view signature) {
  if (signature.front() == 'a') return 1 + completeType(signature.substr(1));
  if (signature.front() != '(') return 1;
  std::size_t length = 1;
  while (signature.at(length) != ')') length += completeType(signature.substr(length));
  return length + 1;
}

// What a container of the signature `whole` holds, and its type for the library.
std::pair<char, std::string> container(std::string_view whole) {
  if (whole.front() == 'a') return {SD_BUS_TYPE_ARRAY, std::string(whole.substr(1))};
  return {SD_BUS_TYPE_STRUCT, std::string(whole.substr(1, whole.size() - 2))};
}

template <class T>
Result<void> appendInteger(sd_bus_message* message, char type, const Value& value) {
  const auto* integer = value.as<std::int64_t>();
  if (!integer || !std::in_range<T>(*integer)) return misfit();
  const T narrowed = static_cast<T>(*integer);
  const int result = sd_bus_message_append_basic(message, type, &narrowed);
  if (result < 0) return failure(result);
  return {};
}

Result<void> appendBasic(sd_bus_message* message, char type, const Value& value) {
  switch (type) {
    case 'y':
      return appendInteger<std::uint8_t>(message, type, value);
    case 'n':
      return appendInteger<std::int16_t>(message, type, value);
    case 'q':
      return appendInteger<std::uint16_t>(message, type, value);
    case 'i':
      return appendInteger<std::int32_t>(message, type, value);
    case 'u':
      return appendInteger<std::uint32_t>(message, type, value);
    case 'x':
      return appendInteger<std::int64_t>(message, type, value);
    case 't':
      return appendInteger<std::uint64_t>(message, type, value);
    default:
      break;
  }
  int result = -EINVAL;
  if (const auto* truth = value.as<bool>(); truth && type == 'b') {
    const int word = *truth ? 1 : 0;
    result = sd_bus_message_append_basic(message, type, &word);
  } else if (const auto* number = value.as<double>(); number && type == 'd') {
    result = sd_bus_message_append_basic(message, type, number);
  } else if (const auto* text = value.as<std::string>();
             text && (type == 's' || type == 'o' || type == 'g')) {
    result = sd_bus_message_append_basic(message, type, text->c_str());
  }
  if (result < 0) return failure(result);
  return {};
}

Result<void> appendContainer(sd_bus_message* message, std::string_view whole, const Value& value) {
  const auto* elements = value.as<List>();
  if (!elements) return misfit();
  const auto [type, contents] = container(whole);
  if (const int result = sd_bus_message_open_container(message, type, contents.c_str()); result < 0)
    return failure(result);
  if (type == SD_BUS_TYPE_STRUCT) {
    if (const auto appended = appendValues(message, contents, *elements); !appended) return appended;
  } else {
    for (const Value& element : *elements) {
      if (const auto appended = appendValues(message, contents, {element}); !appended) return appended;
    }
  }
  if (const int result = sd_bus_message_close_container(message); result < 0) return failure(result);
  return {};
}

template <class T>
Result<Value> readNumber(sd_bus_message* message, char type) {
  T value{};
  if (const int result = sd_bus_message_read_basic(message, type, &value); result <= 0)
    return failure(result == 0 ? -ENXIO : result);
  if constexpr (std::is_same_v<T, double>) {
    return Value(value);
  } else {
    if (!std::in_range<std::int64_t>(value)) return std::make_error_code(std::errc::result_out_of_range);
    return Value(static_cast<std::int64_t>(value));
  }
}

Result<Value> readBasic(sd_bus_message* message, char type) {
  switch (type) {
    case 'y':
      return readNumber<std::uint8_t>(message, type);
    case 'n':
      return readNumber<std::int16_t>(message, type);
    case 'q':
      return readNumber<std::uint16_t>(message, type);
    case 'i':
      return readNumber<std::int32_t>(message, type);
    case 'u':
      return readNumber<std::uint32_t>(message, type);
    case 'x':
      return readNumber<std::int64_t>(message, type);
    case 't':
      return readNumber<std::uint64_t>(message, type);
    case 'd':
      return readNumber<double>(message, type);
    case 'b': {
      const auto word = readNumber<int>(message, type);
      if (!word) return word.error();
      return Value(*word->as<std::int64_t>() != 0);
    }
    case 's':
    case 'o':
    case 'g': {
      const char* text = nullptr;
      if (const int result = sd_bus_message_read_basic(message, type, &text); result <= 0)
        return failure(result == 0 ? -ENXIO : result);
      return Value(text);
    }
    default:
      return misfit();
  }
}

Result<Value> readContainer(sd_bus_message* message, std::string_view whole) {
  const auto [type, contents] = container(whole);
  if (const int result = sd_bus_message_enter_container(message, type, contents.c_str()); result <= 0)
    return failure(result == 0 ? -ENXIO : result);
  List elements;
  if (type == SD_BUS_TYPE_STRUCT) {
    auto fields = readValues(message, contents);
    if (!fields) return fields.error();
    elements = std::move(*fields);
  } else {
    while (sd_bus_message_at_end(message, 0) == 0) {
      auto element = readValues(message, contents);
      if (!element) return element.error();
      elements.push_back(std::move(element->front()));
    }
  }
  if (const int result = sd_bus_message_exit_container(message); result < 0) return failure(result);
  return Value(std::move(elements));
}

bool isContainer(std::string_view type) { return type.front() == 'a' || type.front() == '('; }

}  // namespace

Result<void> appendValues(sd_bus_message* message, std::string_view signature, const List& values) {
  for (const Value& value : values) {
    if (signature.empty()) return misfit();
    const std::string_view type = signature.substr(0, completeType(signature));
    const auto appended =
        isContainer(type) ? appendContainer(message, type, value) : appendBasic(message, type.front(), value);
    if (!appended) return appended;
    signature.remove_prefix(type.size());
  }
  if (!signature.empty()) return misfit();
  return {};
}

Result<List> readValues(sd_bus_message* message, std::string_view signature) {
  List values;
  while (!signature.empty()) {
    const std::string_view type = signature.substr(0, completeType(signature));
    auto value = isContainer(type) ? readContainer(message, type) : readBasic(message, type.front());
    if (!value) return value.error();
    values.push_back(std::move(*value));
    signature.remove_prefix(type.size());
  }
  return values;
}

}  // namespace platform::linux_
