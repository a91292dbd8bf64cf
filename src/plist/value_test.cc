#include "plist/value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <string>

namespace plist {
namespace {

using namespace std::string_literals;

TEST(Describe, WritesEachKindInTheOldStyleForm) {
  struct Case {
    Value value;
    const char* text;
  };
  const Case cases[] = {
      {Value("plain"), "plain"},
      {Value("/usr/bin/mail"), "/usr/bin/mail"},
      {Value("a.b-c:d_$"), "a.b-c:d_$"},
      // Strings that would read back as another kind are quoted (the text round trips cover more).
      {Value(""), "\"\""},
      {Value("true"), "\"true\""},
      {Value("123"), "\"123\""},
      {Value("two words"), "\"two words\""},
      {Value("q\"b\\n\nt\tc\x01"), "\"q\\\"b\\\\n\\nt\\tc\\u0001\""},
      {Value::Integer(-42), "-42"},
      {Value::Real(3), "3.0"},
      {Value::Real(0.1), "0.1"},
      {Value::Real(-0.0), "-0.0"},
      {Value::Real(1e300), "1e+300"},
      {Value::Real(std::nan("")), "<*Rnan>"},
      {Value::Real(-std::numeric_limits<double>::infinity()), "<*R-inf>"},
      {Value::Boolean(false), "false"},
      {Value::FromDate(Date{86400.5}), "<*D2001-01-02 00:00:00 +0000>"},
      {Value::FromData({1, 2, 3, 4, 0xAB}), "<01020304 ab>"},
      {Value::FromData({}), "<>"},
      {Value(Array{}), "()"},
      {Value(Dictionary{}), "{}"},
      {Value(Dictionary{{"b", Value(Array{Value::Integer(1), "x y"})}, {"a", Value(Dictionary{})}}),
       "{\n    b = (\n        1,\n        \"x y\"\n    );\n    a = {};\n}"},
  };
  for (const Case& c : cases) EXPECT_EQ(Describe(c.value), c.text);
}

TEST(Dictionary, FromEntriesKeepsTheFirstPositionAndTheLastValue) {
  const Dictionary d = Dictionary::FromEntries(
      {{"b", Value::Integer(1)}, {"a", Value::Integer(2)}, {"b", Value::Integer(3)}});
  ASSERT_EQ(d.size(), 2u);
  EXPECT_EQ(d.begin()->first, "b");
  EXPECT_EQ(*d.find("b"), Value::Integer(3));
  EXPECT_EQ(*d.find("a"), Value::Integer(2));
}

TEST(ParseDate, ReadsBackWhatFormatDateWrites) {
  const double seconds[] = {0, 1, -1, 744076800, -978307200, -63113904000, 252423993599};
  for (double s : seconds) {
    const std::string text = FormatDate(Date{s}, false);
    ASSERT_TRUE(ParseDate(text)) << text;
    EXPECT_EQ(ParseDate(text)->secondsSince2001, s) << text;
  }
  // A date shows its whole second, the one it falls in, however small its fraction.
  EXPECT_EQ(FormatDate(Date{-1e-9}, false), "2000-12-31 23:59:59 +0000");
  EXPECT_EQ(FormatDate(Date{-10.25}, false), "2000-12-31 23:59:49 +0000");
  // Local time with its offset names the same instant.
  EXPECT_EQ(ParseDate("2001-01-01 02:30:00 +0230")->secondsSince2001, 0);
  EXPECT_EQ(ParseDate("2000-12-31 23:00:00 -0100")->secondsSince2001, 0);
  EXPECT_EQ(ParseDate("2001-01-01T00:01:00Z")->secondsSince2001, 60);
  EXPECT_EQ(ParseDate("2000-02-29T00:00:00Z")->secondsSince2001, -307 * 86400);
}

TEST(ParseDate, RejectsWhatIsNoDate) {
  const char* cases[] = {"",
                         "2001-02-29T00:00:00Z",
                         "1900-02-29 00:00:00 +0000",
                         "2001-13-01T00:00:00Z",
                         "2001-01-01T24:00:00Z",
                         "2001-01-01T00:60:00Z",
                         "0000-01-01T00:00:00Z",
                         "2001-01-01 00:00:00 +2400",
                         "2001-01-01 00:00:00Z",
                         "2001-01-01T00:00:00",
                         "2001/01/01T00:00:00Z",
                         "2001-01-01T00:00:0aZ"};
  for (const char* text : cases) EXPECT_FALSE(ParseDate(text)) << text;
}

TEST(IsValidUtf8, AcceptsOnlyWellFormedSequences) {
  struct Case {
    std::string bytes;
    bool valid;
  };
  const Case cases[] = {
      {"", true},
      {"ascii\x7F"s, true},
      {"\0"s, true},
      {"é 日 😀", true},
      {"\xF4\x8F\xBF\xBF", true},   // U+10FFFF
      {"\x80", false},              // continuation without a lead
      {"\xC0\x80", false},          // overlong NUL
      {"\xC1\xBF", false},          // overlong
      {"\xE0\x9F\xBF", false},      // overlong three-byte form
      {"\xED\xA0\x80", false},      // surrogate
      {"\xF0\x8F\xBF\xBF", false},  // overlong four-byte form
      {"\xF4\x90\x80\x80", false},  // above U+10FFFF
      {"\xF5\x80\x80\x80", false},
      {"\xE6\x97", false},  // cut short
      {"\xC3\x28", false},
  };
  for (const Case& c : cases) EXPECT_EQ(IsValidUtf8(c.bytes), c.valid) << c.bytes;
}

TEST(Value, ConvertsStringsToNumbersByTheirLeadingText) {
  constexpr double kInf = std::numeric_limits<double>::infinity();
  struct Case {
    Value value;
    double number;
    int64_t integer;
    bool boolean;
  };
  const Case cases[] = {
      {Value("  12.5e1xyz"), 125, 12, true},
      {Value("-7 apples"), -7, -7, true},
      {Value("yes"), 0, 0, true},
      {Value("0"), 0, 0, false},
      {Value("99999999999999999999"), 1e20, std::numeric_limits<int64_t>::max(), true},
      {Value::Real(-1e300), -1e300, std::numeric_limits<int64_t>::min(), true},
      {Value::Boolean(true), 1, 1, true},
      {Value::FromDate(Date{-2.5}), -2.5, -2, false},
      {Value(Array{Value::Integer(1)}), 0, 0, false},
      // Out of range: the value decides, whatever the spelling of its exponent.
      {Value("1E-400"), 0, 1, true},
      {Value("-1E-400"), -0.0, -1, true},
      {Value("0.0001e-320"), 0, 0, false},
      {Value("1e400"), kInf, 1, true},
      {Value("-0.5e310"), -kInf, 0, false},
      {Value("1" + std::string(400, '0') + "e-10"), kInf, std::numeric_limits<int64_t>::max(),
       true},
      // Unicode white space is skipped like ASCII white space.
      {Value("\u00a0\u3000 1000"), 1000, 1000, true},
      {Value("\u2028-3"), -3, -3, true},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(c.value.numberValue(), c.number) << Describe(c.value);
    EXPECT_EQ(std::signbit(c.value.numberValue()), std::signbit(c.number)) << Describe(c.value);
    EXPECT_EQ(c.value.integerValue(), c.integer) << Describe(c.value);
    EXPECT_EQ(c.value.boolValue(), c.boolean) << Describe(c.value);
  }
}

}  // namespace
}  // namespace plist
