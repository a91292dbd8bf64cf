#include "context/format_suffix.h"

#include <gtest/gtest.h>

#include <cmath>
#include <string>

#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Value;

std::string Text(const std::optional<Value>& value) {
  return value ? value->textForm() : std::string("<absent>");
}

struct Case {
  std::optional<Value> value;
  const char* suffix;
  const char* expected;
};

TEST(FormatSuffix, FormatsTheValueByTheFirstTriggerCharacter) {
  const Case cases[] = {
      {Value::Real(3.7), "%d", "3"},
      {Value::Integer(255), "%x", "ff"},
      {Value::Integer(255), "%#06X", "0X00FF"},
      {Value::Real(3.14159), "%5.1f", "  3.1"},
      {Value("2.5 apples"), "%.2f", "2.50"},
      {Value("1e3"), "%d", "1"},  // the integer of a string stops at the first non-digit
      {Value("1e3"), "%g", "1000"},
      {Value::Integer(-1), "%u", "18446744073709551615"},
      {Value::Boolean(true), "%d", "1"},
      {Value::Integer(42), "%lld", "42"},
      {Value::Integer(42), "%qu", "42"},
      {Value::Integer(42), "%Lf", "42.000000"},
      {Value::Integer(7), "%-4d|", "7   |"},
      {Value::Integer(5), "%d%%", "5%"},
      {Value::Real(2.25), "%.1f MB", "2.2 MB"},
      {Value::Integer(65), "%c", "A"},
      {Value::Integer(0), "%3c", "   "},  // no NUL byte in a text value
      {std::nullopt, "%d", "0"},          // an absent value counts as 0
      {std::nullopt, "%05.1f", "000.0"},
      // "%t": seconds since 2001 as a UTC date.
      {Value::Integer(0), "%t", "2001-01-01 00:00:00 +0000"},
      {Value("not a number"), "%t", "2001-01-01 00:00:00 +0000"},
      {std::nullopt, "%t", "2001-01-01 00:00:00 +0000"},
      {Value::Real(86400 + 3661.5), "%t", "2001-01-02 01:01:01 +0000"},
      {Value::FromDate({60}), "%t", "2001-01-01 00:01:00 +0000"},
      {Value::Integer(-63113904000), "%t", "0001-01-01 00:00:00 +0000"},
      {Value::Integer(252423993599), "%t", "9999-12-31 23:59:59 +0000"},
      // "%m": a byte amount in binary units with one decimal.
      {Value::Real(0), "%m", "0 bytes"},
      {Value::Real(1023), "%m", "1023 bytes"},
      {Value::Real(1024), "%m", "1.0 KB"},
      {Value::Real(1536), "%m", "1.5 KB"},
      {Value::Real(1048575), "%m", "1.0 MB"},
      {Value::Real(3.5 * (1 << 30)), "%m", "3.5 GB"},
      {Value::Real(-2048), "%m", "-2.0 KB"},
      {Value::Real(1e30), "%m", "867361737988.4 EB"},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(Text(ApplyFormatSuffix(c.value, c.suffix)), c.expected) << c.suffix;
  }
}

TEST(FormatSuffix, ValuesComeBackUnchangedWithoutASafeTriggerAndContainersAlways) {
  // Under ASan/UBSan any extra argument read or "%n" write would abort this test.
  const Value v = Value::Integer(12);
  for (const char* suffix : {"%@", "%s", "%o", "%ls", "%hhn", "%p", "%n%d", "%s%d", "%d%d", "%*d",
                             "%.*f", "%1$d", "%d%", "%n", "%hhn%x", "%ld%ls", "%'*.*f", "%d %s"}) {
    EXPECT_EQ(ApplyFormatSuffix(v, suffix), v) << suffix;
  }
  EXPECT_EQ(ApplyFormatSuffix(std::nullopt, "%@"), std::nullopt);
  const Value array(plist::Array{Value("a")});
  const Value data = Value::FromData({1, 2});
  for (const char* suffix : {"%t", "%m", "%d", "%f"}) {
    EXPECT_EQ(ApplyFormatSuffix(array, suffix), array) << suffix;
    EXPECT_EQ(ApplyFormatSuffix(data, suffix), data) << suffix;
  }
}

TEST(FormatSuffix, ClampsHugeWidthsAndPrecisionsToABoundedText) {
  const Value v = Value::Integer(5);
  const std::string wide = Text(ApplyFormatSuffix(v, "%1000000d"));
  EXPECT_EQ(wide.size(), 1000u);
  EXPECT_EQ(wide.back(), '5');
  const std::string precise = Text(ApplyFormatSuffix(Value::Real(1e308), "%.99999999999f"));
  EXPECT_EQ(precise.size(), 309u + 1 + 100);

  const std::string manyFlags = "%" + std::string(9998, '-') + "d";
  EXPECT_EQ(Text(ApplyFormatSuffix(v, manyFlags)), "5");
  const std::string longTrailer = "%d" + std::string(9998, 'a');
  EXPECT_EQ(Text(ApplyFormatSuffix(v, longTrailer)), "5" + std::string(9998, 'a'));
  const std::string longWidth = "%" + std::string(9998, '9') + "d";
  EXPECT_EQ(Text(ApplyFormatSuffix(v, longWidth)).size(), 1000u);
}

TEST(FormatSuffix, TimeSuffixRefusesDatesOutsideTheYears1To9999) {
  testing::LogCapture capture(1);
  const Value outside[] = {Value::Integer(252423993600), Value::Real(1e12),
                           Value::Integer(-63113904001), Value::FromDate({-1e15}),
                           Value::Real(std::nan("")),    Value::Real(HUGE_VAL)};
  for (const Value& value : outside) {
    SCOPED_TRACE(Describe(value));
    const auto result = ApplyFormatSuffix(value, "%t");
    ASSERT_TRUE(result);
    EXPECT_EQ(*result, value);
  }
  const std::string log = capture.text();
  EXPECT_NE(log.find("ApplyFormatSuffix: 252423993600 seconds since 2001 lie outside the years 1 "
                     "to 9999; %t not applied\n"),
            std::string::npos)
      << log;
  EXPECT_NE(log.find("ApplyFormatSuffix: inf seconds"), std::string::npos) << log;
}

}  // namespace
}  // namespace tarvod
