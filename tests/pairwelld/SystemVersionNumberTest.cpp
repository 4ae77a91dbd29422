#include "pairwelld/SystemVersionNumber.hpp"

#include <gtest/gtest.h>

namespace pairwell {
namespace {

// "number|letter|child|build|suffix" and the printed form.
std::string parts(const SystemVersionNumber& version) {
  return std::to_string(version.baseNumber) + "|" + version.baseLetter + "|" +
         (version.childType ? std::to_string(*version.childType) : "") + "|" +
         std::to_string(version.buildNumber) + "|" + version.suffix.value_or("") + " " +
         version.description();
}

TEST(SystemVersionNumberTest, ParsesCharactersAsAPersonSeesThem) {
  const struct {
    const char *name, *text, *parts;
  } rows[] = {
      {"whole", "21A5248v", "21|A|5|248|v 21A5248v"},
      {"at the threshold", "21A1000", "21|A|1|0| 21A10"},
      {"leading zeros lost", "19A5007", "19|A|5|7| 19A57"},
      {"combining mark on the letter", "21A\u03012", "21|A\u0301||2| 21A\u03012"},
      {"flag as suffix", "21A2\U0001F1EB\U0001F1F7", "21|A||2|\U0001F1EB\U0001F1F7 21A2\U0001F1EB\U0001F1F7"},
      {"greatest number", "9223372036854775807A1", "9223372036854775807|A||1| 9223372036854775807A1"},
  };
  for (const auto& row : rows) {
    const auto version = SystemVersionNumber::fromString(row.text);
    ASSERT_TRUE(version) << row.name;
    EXPECT_EQ(parts(*version), row.parts) << row.name;
    EXPECT_EQ(version->rawValue, row.text);
  }
  for (const char* none :
       {"21A2\U0001F1EB\U0001F1F7\U0001F1E9\U0001F1EA", "21A2\u0301", "9223372036854775808A1",
        "1A9223372036854775808", "-21A2", " 21A2", "\u0662\u0661A2", "21A5248ve", "21A", "A21", "21", ""})
    EXPECT_FALSE(SystemVersionNumber::fromString(none)) << none;
}

TEST(SystemVersionNumberTest, OrdersByComponentAndEqualsByText) {
  const struct {
    const char *a, *b;
    bool less, greater;
  } pairs[] = {
      {"21A5248v", "21A5248w", true, false}, {"21A5248", "21A5248a", true, false},
      {"9A1", "10A1", true, false},          {"21A200", "21B100", true, false},
      {"21A100", "21A200", true, false},     {"21A5248", "21A6248", false, false},
      {"21A5999", "21A6000", false, true},   {"21Z1", "21\u00e91", true, false},
  };
  for (const auto& pair : pairs) {
    SCOPED_TRACE(std::string(pair.a) + " and " + pair.b);
    const auto a = *SystemVersionNumber::fromString(pair.a), b = *SystemVersionNumber::fromString(pair.b);
    EXPECT_EQ(a < b, pair.less);
    EXPECT_EQ(b < a, pair.greater);
    EXPECT_FALSE(a == b);
  }
}

}  // namespace
}  // namespace pairwell
