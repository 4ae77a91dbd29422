#include "platform/Value.hpp"

#include <gtest/gtest.h>

#include <limits>

#include "platform/LogSink.hpp"
#include "platform/NotificationCentre.hpp"
#include "platform/UUID.hpp"

namespace platform {
namespace {

TEST(Value, PrintsAsLogLinesNeedIt) {
  const std::pair<Value, const char*> rows[] = {
      {0.5, "0.5"},
      {1e16, "1e+16"},
      {-0.0, "-0.0"},
      {0.00005, "0.00005"},
      {std::numeric_limits<double>::infinity(), "inf"},
      {List{1, "a", nullptr}, "[1, \"a\", null]"},
      {Dictionary{}, "[:]"},
      {Dictionary{{"b", 1.5}, {"a", List{true}}}, "[\"a\": [true], \"b\": 1.5]"},
  };
  for (const auto& [value, text] : rows) EXPECT_EQ(describe(value), text);
  EXPECT_EQ(describe(std::optional<Value>()), "nil");
}

TEST(Value, ConvertsOnlyWhereExact) {
  EXPECT_EQ(toBool(0.0), false);
  EXPECT_EQ(toBool(2), std::nullopt);
  EXPECT_EQ(toInteger(5.5), std::nullopt);
  EXPECT_EQ(toInteger(0x1p63), std::nullopt);
  EXPECT_EQ(toInteger(-0x1p63), std::numeric_limits<std::int64_t>::min());
  EXPECT_EQ(toInteger(std::numeric_limits<double>::quiet_NaN()), std::nullopt);
  EXPECT_EQ(toDouble(std::numeric_limits<std::int64_t>::max()), std::nullopt);
  EXPECT_EQ(toTexts(List{"a", 1}), std::nullopt);
}

TEST(UUIDTest, ReadsEitherCaseAndWritesUpper) {
  const auto uuid = UUID::parse("0f8fad5b-d9cb-469F-a165-70867728950e");
  EXPECT_EQ(uuid.value().text(), "0F8FAD5B-D9CB-469F-A165-70867728950E");
  for (const char* bad : {"", "0f8fad5bd9cb469fa16570867728950e", "0f8fad5b-d9cb-469f-a165-70867728950",
                          "0f8fad5b-d9cb-469f-a165-70867728950g", "0f8fad5b-d9cb-469f-a165+70867728950e"}) {
    EXPECT_FALSE(UUID::parse(bad)) << bad;
  }
  EXPECT_NE(UUID::random(), UUID::random());
}

TEST(LogFormat, FillsPlaceholdersInOrderAndHidesTexts) {
  const LogArgument arguments[] = {std::string("a%d"), std::int64_t{-1}, std::uint64_t{4294967295}, 12.9,
                                   true};
  constexpr std::string_view format = "%s %d %u %f %{bool}d 100%";
  EXPECT_EQ(formatLogMessage(format, arguments, false), "a%d -1 4294967295 12.900000 true 100%");
  EXPECT_EQ(formatLogMessage(format, arguments, true), "<private> -1 4294967295 12.900000 true 100%");
}

struct Observer {
  void noted(const Notification&) {
    ++count;
    if (onNote) onNote();
  }
  int count = 0;
  std::function<void()> onNote;
};

TEST(NotificationCentreTest, CallsNobodyWhoWasRemovedDuringThePost) {
  NotificationCentre centre;
  const auto first = std::make_shared<Observer>(), second = std::make_shared<Observer>();
  for (const auto& observer : {first, second}) centre.addObserver(observer, &Observer::noted, "n", nullptr);
  first->onNote = [&] { centre.removeObserver(second.get()); };
  for (const char* name : {"n", "other"}) centre.post(name, nullptr, std::nullopt);
  EXPECT_EQ(first->count, 1);
  EXPECT_EQ(second->count, 0);
}

}  // namespace
}  // namespace platform
