#include "platform/linux/Json.hpp"

#include <cmath>
#include <cstddef>
#include <iterator>
#include <limits>
#include <nlohmann/json.hpp>
#include <optional>
#include <utility>
#include <vector>

namespace platform::linux_ {
namespace {

using Json = nlohmann::json;

// Writing deeper nesting than a reader takes would lose the file; deeper reading than that overflows the
// stack.
constexpr std::size_t maximumDepth = 32;
constexpr const char* dateEntry = "$date";
constexpr const char* doubleEntry = "$double";

// {"$date": n} and {"$double": "inf"}.
std::optional<Value> special(const Dictionary& dictionary) {
  if (dictionary.size() != 1) return std::nullopt;
  const auto& [key, value] = *dictionary.begin();
  if (key == dateEntry) {
    if (const auto* nanoseconds = value.as<std::int64_t>()) return Value(Date{*nanoseconds});
  }
  if (key == doubleEntry) {
    const auto text = toText(value);
    if (text == "inf") return Value(std::numeric_limits<double>::infinity());
    if (text == "-inf") return Value(-std::numeric_limits<double>::infinity());
    if (text == "nan") return Value(std::numeric_limits<double>::quiet_NaN());
  }
  return std::nullopt;
}

class Reader : public nlohmann::json_sax<Json> {
 public:
  bool null() override { return add(nullptr); }
  bool boolean(bool value) override { return add(value); }
  bool number_integer(number_integer_t value) override { return add(Value(std::int64_t{value})); }
  bool number_unsigned(number_unsigned_t value) override {
    // One beyond 64 bits is a double, as the parser has it for still greater ones: at most its entry is of no
    // use.
    if (value > static_cast<number_unsigned_t>(std::numeric_limits<std::int64_t>::max()))
      return add(Value(static_cast<double>(value)));
    return add(Value(static_cast<std::int64_t>(value)));
  }
  bool number_float(number_float_t value, const string_t&) override {
    return std::isfinite(value) ? add(value) : fail("a number that is not finite");
  }
  bool string(string_t& value) override { return add(Value(std::move(value))); }
  bool binary(binary_t&) override { return fail("binary data"); }
  bool start_object(std::size_t) override { return open(Dictionary{}); }
  bool start_array(std::size_t) override { return open(List{}); }
  bool end_object() override {
    if (auto value = special(std::get<Dictionary>(levels.back().container.storage))) {
      levels.back().container = std::move(*value);
    }
    return close();
  }
  bool end_array() override { return close(); }
  bool key(string_t& name) override {
    const auto& dictionary = std::get<Dictionary>(levels.back().container.storage);
    const bool isBehindAll = dictionary.empty() || dictionary.rbegin()->first < name;  // as they are printed
    if (!isBehindAll && dictionary.contains(name)) return fail("the key \"" + name + "\" twice");
    levels.back().key = std::move(name);
    return true;
  }
  bool parse_error(std::size_t, const std::string& token, const nlohmann::detail::exception& error) override {
    // The library's text without its own name and place.
    const std::string_view what = error.what();
    const auto reason = what.find(": ");
    problem = std::string(reason == what.npos ? what : what.substr(reason + 2));
    if (problem.empty()) problem = "unexpected " + token;
    return false;
  }

  Value result;
  std::string problem;

 private:
  struct Level {
    Value container;
    std::string key;
  };

  bool open(Value container) {
    if (levels.size() == maximumDepth) return fail("more than 32 levels");
    levels.push_back({std::move(container), {}});
    return true;
  }
  bool close() {
    Value container = std::move(levels.back().container);
    levels.pop_back();
    return add(std::move(container));
  }
  bool add(Value value) {
    if (levels.empty()) {
      result = std::move(value);
      return true;
    }
    Level& level = levels.back();
    if (auto* list = std::get_if<List>(&level.container.storage)) {
      list->push_back(std::move(value));
    } else {
      auto& dictionary = std::get<Dictionary>(level.container.storage);
      dictionary.emplace_hint(dictionary.end(), std::move(level.key), std::move(value));
    }
    return true;
  }
  bool fail(std::string what) {
    problem = std::move(what);
    return false;
  }

  std::vector<Level> levels;
};

// Line and column, from 1, of a byte.
std::string place(std::string_view text, std::size_t position) {
  std::size_t line = 1, column = 1;
  for (const char character : text.substr(0, position)) {
    column = character == '\n' ? 1 : column + 1;
    if (character == '\n') ++line;
  }
  return "line " + std::to_string(line) + ", column " + std::to_string(column);
}

// Counts what the parser has read, since its callbacks are not told where they are.
class CountingIterator {
 public:
  using iterator_category = std::input_iterator_tag;
  using value_type = char;
  using difference_type = std::ptrdiff_t;
  using pointer = const char*;
  using reference = const char&;

  CountingIterator(const char* at_, const char** furthest_) : at(at_), furthest(furthest_) {}
  reference operator*() const { return *at; }
  CountingIterator& operator++() {
    ++at;
    if (furthest) *furthest = at;
    return *this;
  }
  friend bool operator!=(const CountingIterator& a, const CountingIterator& b) { return a.at != b.at; }

 private:
  const char* at;
  const char** furthest;
};

Json toJson(const Value& value, std::size_t depth);

struct Writer {
  std::size_t depth;

  Json operator()(std::nullptr_t) const { return nullptr; }
  Json operator()(bool value) const { return value; }
  Json operator()(std::int64_t value) const { return value; }
  Json operator()(double value) const {
    if (std::isfinite(value)) return value;
    return Json::object({{doubleEntry, std::isnan(value) ? "nan" : value > 0 ? "inf" : "-inf"}});
  }
  Json operator()(const std::string& value) const { return value; }
  Json operator()(Date value) const { return Json::object({{dateEntry, value.nanoseconds}}); }
  Json operator()(const List& list) const {
    Json json = Json::array();
    for (const Value& element : list) json.push_back(toJson(element, depth + 1));
    return json;
  }
  Json operator()(const Dictionary& dictionary) const {
    Json::object_t object;
    for (const auto& [key, element] : dictionary)
      object.emplace_hint(object.end(), key, toJson(element, depth + 1));
    return object;
  }
};

struct TooDeep {};

Json toJson(const Value& value, std::size_t depth) {
  const bool container = value.as<List>() || value.as<Dictionary>();
  if (container && depth >= maximumDepth) throw TooDeep();
  return std::visit(Writer{depth}, value.storage);
}

}  // namespace

Result<Value> parseJson(std::string_view text, std::string& problem) {
  Reader reader;
  const char* furthest = text.data();
  const char* end = text.data() + text.size();
  if (Json::sax_parse(CountingIterator(text.data(), &furthest), CountingIterator(end, nullptr), &reader)) {
    return std::move(reader.result);
  }
  problem = place(text, static_cast<std::size_t>(furthest - text.data())) + ": " + reader.problem;
  return Outcome::malformedFile;
}

Result<std::string> printJson(const Value& value, JsonStyle style) {
  try {
    return toJson(value, 0).dump(style == JsonStyle::indented ? 2 : -1, ' ', false,
                                 Json::error_handler_t::replace);
  } catch (const TooDeep&) {
    return Outcome::tooLarge;
  }
}

}  // namespace platform::linux_
