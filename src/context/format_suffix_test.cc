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

TEST(FormatSuffix, FormatsTheValuesNumberOrIntegerByTheFirstTriggerCharacter) {
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
  };
  for (const Case& c : cases) {
    EXPECT_EQ(Text(ApplyFormatSuffix(c.value, c.suffix)), c.expected) << c.suffix;
  }
}

TEST(FormatSuffix, SuffixesWithoutATriggerReturnTheValueUnchanged) {
  const Value v = Value::Integer(12);
  for (const char* suffix : {"%@", "%s", "%o", "%ls", "%hhn", "%p"}) {
    EXPECT_EQ(ApplyFormatSuffix(v, suffix), v) << suffix;
  }
  EXPECT_EQ(ApplyFormatSuffix(std::nullopt, "%@"), std::nullopt);
}

TEST(FormatSuffix, HostileSuffixesNeverReachTheFormatterAsWritten) {
  // Under ASan/UBSan any extra argument read or "%n" write would abort this test.
  const Value v = Value::Integer(5);
  for (const char* suffix : {"%n%d", "%s%d", "%d%d", "%*d", "%.*f", "%1$d", "%d%", "%n", "%hhn%x",
                             "%ld%ls", "%'*.*f", "%d %s"}) {
    EXPECT_EQ(ApplyFormatSuffix(v, suffix), v) << suffix;
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

TEST(FormatSuffix, TimeSuffixShowsSecondsSince2001AsAUtcDate) {
  EXPECT_EQ(Text(ApplyFormatSuffix(Value::Integer(0), "%t")), "2001-01-01 00:00:00 +0000");
  EXPECT_EQ(Text(ApplyFormatSuffix(Value("not a number"), "%t")), "2001-01-01 00:00:00 +0000");
  EXPECT_EQ(Text(ApplyFormatSuffix(std::nullopt, "%t")), "2001-01-01 00:00:00 +0000");
  EXPECT_EQ(Text(ApplyFormatSuffix(Value::Real(86400 + 3661.5), "%t")),
            "2001-01-02 01:01:01 +0000");
  EXPECT_EQ(Text(ApplyFormatSuffix(Value::FromDate({60}), "%t")), "2001-01-01 00:01:00 +0000");
  EXPECT_EQ(Text(ApplyFormatSuffix(Value::Integer(-63113904000), "%t")),
            "0001-01-01 00:00:00 +0000");
  EXPECT_EQ(Text(ApplyFormatSuffix(Value::Integer(252423993599), "%t")),
            "9999-12-31 23:59:59 +0000");
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

TEST(FormatSuffix, ByteAmountsReadInBinaryUnitsWithOneDecimal) {
  const std::pair<double, const char*> cases[] = {
      {0, "0 bytes"},
      {512, "512 bytes"},
      {1023, "1023 bytes"},
      {1024, "1.0 KB"},
      {1536, "1.5 KB"},
      {1048575, "1.0 MB"},
      {3.5 * (1 << 30), "3.5 GB"},
      {-2048, "-2.0 KB"},
      {1e30, "867361737988.4 EB"},
  };
  for (const auto& [bytes, expected] : cases) {
    EXPECT_EQ(Text(ApplyFormatSuffix(Value::Real(bytes), "%m")), expected) << bytes;
  }
}

TEST(FormatSuffix, ContainersAndDataComeBackUnchangedUnderEverySuffix) {
  const Value array(plist::Array{Value("a")});
  const Value data = Value::FromData({1, 2});
  for (const char* suffix : {"%t", "%m", "%d", "%f"}) {
    EXPECT_EQ(ApplyFormatSuffix(array, suffix), array) << suffix;
    EXPECT_EQ(ApplyFormatSuffix(data, suffix), data) << suffix;
  }
}

}  // namespace
}  // namespace tarvod
