#include "platform/linux/Json.hpp"

#include <gtest/gtest.h>

#include <limits>

namespace platform::linux_ {
namespace {

std::string nested(std::size_t levels) { return std::string(levels, '[') + std::string(levels, ']'); }

TEST(JsonTest, RefusesWhatItCouldNotKeepAndSaysWhere) {
  for (const std::string& text :
       {nested(33), nested(100'000), std::string("{\"a\": 1,\n \"a\": 1}"), std::string("\n[1e400]"),
        std::string("\"\xff\""), std::string("1 2"), std::string()}) {
    std::string problem;
    EXPECT_EQ(parseJson(text, problem).error(), Outcome::malformedFile) << text.substr(0, 40);
    const std::string place = text.find('\n') == text.npos ? "line 1, column " : "line 2, column ";
    EXPECT_EQ(problem.rfind(place, 0), 0u) << problem;
  }
}

TEST(JsonTest, ReadsBackWhatItWrote) {
  using Limits = std::numeric_limits<std::int64_t>;
  const Value value =
      Dictionary{{"integers", List{Limits::min(), Limits::max(), std::int64_t{0}}},
                 {"doubles", List{5.0, -0.5, 1e300, 5e-324, std::numeric_limits<double>::infinity()}},
                 {"others", List{nullptr, true, "\"\n\xc3\xa9", Date{-1}, Dictionary{}}}};
  std::string problem;
  for (const JsonStyle style : {JsonStyle::line, JsonStyle::indented})
    EXPECT_EQ(parseJson(*printJson(value, style), problem).value(), value);
  EXPECT_TRUE(parseJson(nested(32), problem)) << problem;
  EXPECT_EQ(parseJson("9223372036854775808", problem).value(), Value(0x1p63))
      << "its entry's fault, not the file's";
  EXPECT_EQ(printJson("\xff", JsonStyle::line).value(), "\"\xef\xbf\xbd\"");
}

}  // namespace
}  // namespace platform::linux_
