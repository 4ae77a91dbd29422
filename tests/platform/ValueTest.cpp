#include "platform/Value.hpp"

#include <gtest/gtest.h>

#include <limits>

#include "platform/LogSink.hpp"
#include "platform/NotificationCentre.hpp"
#include "platform/UUID.hpp"

namespace platform {
namespace {

constexpr double infinity = std::numeric_limits<double>::infinity();

TEST(Value, PrintsAsLogLinesNeedIt) {
  const struct {
    Value value;
    const char* text;
  } rows[] = {
      {60.0, "60.0"},
      {0.5, "0.5"},
      {100000.0, "100000.0"},
      {1e15, "1000000000000000.0"},
      {1e16, "1e+16"},
      {-0.0, "-0.0"},
      {9007199254740993.0, "9007199254740992.0"},
      {0.1, "0.1"},
      {0.00005, "0.00005"},
      {infinity, "inf"},
      {std::int64_t{-5}, "-5"},
      {true, "true"},
      {nullptr, "null"},
      {"plain", "plain"},
      {List{1, "a", nullptr}, "[1, \"a\", null]"},
      {List{}, "[]"},
      {Dictionary{}, "[:]"},
      {Dictionary{{"b", 1.5}, {"a", List{true}}}, "[\"a\": [true], \"b\": 1.5]"},
  };
  for (const auto& row : rows) EXPECT_EQ(describe(row.value), row.text);
  EXPECT_EQ(describe(std::optional<Value>()), "nil");
}

TEST(Value, ConvertsOnlyWhereExact) {
  EXPECT_EQ(toBool(1), true);
  EXPECT_EQ(toBool(0.0), false);
  EXPECT_EQ(toBool(2), std::nullopt);
  EXPECT_EQ(toBool("true"), std::nullopt);
  EXPECT_EQ(toInteger(5.0), 5);
  EXPECT_EQ(toInteger(5.5), std::nullopt);
  EXPECT_EQ(toInteger(0x1p63), std::nullopt);
  EXPECT_EQ(toInteger(-0x1p63), std::numeric_limits<std::int64_t>::min());
  EXPECT_EQ(toInteger(std::numeric_limits<double>::quiet_NaN()), std::nullopt);
  EXPECT_EQ(toDouble(std::int64_t{9007199254740993}), std::nullopt);
  EXPECT_EQ(toDouble(std::numeric_limits<std::int64_t>::max()), std::nullopt);
  EXPECT_EQ(toDouble(true), 1.0);
  EXPECT_EQ(toDouble(nullptr), std::nullopt);
  EXPECT_EQ(toTexts(List{"a", 1}), std::nullopt);
}

TEST(UUIDTest, ReadsEitherCaseAndWritesUpper) {
  const auto uuid = UUID::parse("0f8fad5b-d9cb-469F-a165-70867728950e");
  ASSERT_TRUE(uuid);
  EXPECT_EQ(uuid->text(), "0F8FAD5B-D9CB-469F-A165-70867728950E");
  for (const char* bad : {"", "0f8fad5bd9cb469fa16570867728950e", "0f8fad5b-d9cb-469f-a165-70867728950",
                          "0f8fad5b-d9cb-469f-a165-70867728950g", "0f8fad5b-d9cb-469f-a165+70867728950e"}) {
    EXPECT_FALSE(UUID::parse(bad)) << bad;
  }
  EXPECT_NE(UUID::random(), UUID::random());
  EXPECT_EQ(UUID::random().text()[14], '4');
}

TEST(LogFormat, FillsPlaceholdersInOrderAndHidesTexts) {
  const LogArgument arguments[] = {std::string("a%d"), std::int64_t{-1}, std::uint64_t{4294967295}, 12.9,
                                   true};
  constexpr std::string_view format = "%s %d %u %f %{bool}d 100%";
  EXPECT_EQ(formatLogMessage(format, arguments, false), "a%d -1 4294967295 12.900000 true 100%");
  EXPECT_EQ(formatLogMessage(format, arguments, true), "<private> -1 4294967295 12.900000 true 100%");
}

struct Observer {
  void noted(const Notification& notification) {
    names.push_back(notification.name);
    if (onNote) onNote();
  }
  std::vector<std::string> names;
  std::function<void()> onNote;
};

TEST(NotificationCentreTest, CallsNeitherTheDeadNorTheRemoved) {
  NotificationCentre centre;
  auto first = std::make_shared<Observer>();
  auto second = std::make_shared<Observer>();
  auto third = std::make_shared<Observer>();
  const int sender = 0;
  for (const auto& observer : {first, second, third})
    centre.addObserver(observer, &Observer::noted, "n", nullptr);
  centre.addObserver(first, &Observer::noted, "n", &sender);
  std::weak_ptr<Observer> dead = second;
  first->onNote = [&] {
    second.reset();
    centre.removeObserver(third.get());
  };
  centre.post("n", nullptr, std::nullopt);
  centre.post("other", &sender, std::nullopt);
  EXPECT_EQ(first->names.size(), 1u);
  EXPECT_TRUE(dead.expired());
  EXPECT_TRUE(third->names.empty());
  centre.post("n", &sender, std::nullopt);
  EXPECT_EQ(first->names.size(), 3u);
}

}  // namespace
}  // namespace platform
