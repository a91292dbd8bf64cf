#include "context/arithmetic.h"

#include <gtest/gtest.h>

#include <string>

namespace tarvod {
namespace {

struct Case {
  const char* text;
  plist::Value expected;
};

TEST(Arithmetic, EvaluatesWithTheUsualPrecedenceAndKeepsIntegralResultsIntegers) {
  const Case cases[] = {
      {"42", plist::Value::Integer(42)},
      {" 7 ", plist::Value::Integer(7)},
      {"3 * (2 + 1)", plist::Value::Integer(9)},
      {"100 / 4", plist::Value::Integer(25)},
      {"12/25/2008", plist::Value::Real(12.0 / 25.0 / 2008.0)},
      {"1 + 2 * 3 - 4 / 2", plist::Value::Integer(5)},
      {"10 - 4 - 3", plist::Value::Integer(3)},  // left associative
      {"2 * -3", plist::Value::Integer(-6)},
      {"-(2 + 3) * 2", plist::Value::Integer(-10)},
      {"--4", plist::Value::Integer(4)},
      {"7 / 2", plist::Value::Real(3.5)},
      {"2.5 * 2", plist::Value::Integer(5)},
      {".5 + 0.25", plist::Value::Real(0.75)},
      {"1.5", plist::Value::Real(1.5)},
      {"\t1\n+\n1", plist::Value::Integer(2)},
      // Past the 64-bit range integers turn into reals instead of wrapping.
      {"9223372036854775807 + 1", plist::Value::Real(9223372036854775808.0)},
      {"99999999999999999999", plist::Value::Real(1e20)},
      {"-9223372036854775807 - 1", plist::Value::Integer(INT64_MIN)},
  };
  for (const Case& c : cases) {
    const ArithmeticResult r = EvaluateArithmetic(c.text);
    ASSERT_TRUE(r.value.has_value()) << c.text << ": " << r.failure;
    EXPECT_EQ(*r.value, c.expected) << c.text << " gave " << r.value->textForm();
  }
}

TEST(Arithmetic, ReportsMalformedExpressionsAndDivisionByZeroAsFailures) {
  for (const char* text : {"1 2", "()", "", "   ", "1 +", "(1", "1)", "* 2", ".", "1..2", "1.2.3",
                           "4 / 0", "4 / (2 - 2)", "1 / 0.0", "2 x 3"}) {
    const ArithmeticResult r = EvaluateArithmetic(text);
    EXPECT_FALSE(r.value.has_value()) << text;
    EXPECT_FALSE(r.failure.empty()) << text;
  }
  EXPECT_NE(EvaluateArithmetic("4 / 0").failure.find("division by zero"), std::string::npos);
}

TEST(Arithmetic, HandlesHundredThousandNestedParenthesesWithoutRecursion) {
  const std::string nested = std::string(100000, '(') + "1" + std::string(100000, ')');
  const ArithmeticResult r = EvaluateArithmetic(nested);
  ASSERT_TRUE(r.value.has_value()) << r.failure;
  EXPECT_EQ(*r.value, plist::Value::Integer(1));

  EXPECT_FALSE(EvaluateArithmetic(std::string(100000, '(')).value.has_value());
  EXPECT_FALSE(EvaluateArithmetic(std::string(100000, ')')).value.has_value());
  const std::string negations = std::string(100001, '-') + "1";
  EXPECT_EQ(*EvaluateArithmetic(negations).value, plist::Value::Integer(-1));
}

TEST(Arithmetic, CandidatesNeedADigitAndOnlyArithmeticCharacters) {
  for (const char* text : {"42", "12/25/2008", "1 2"}) EXPECT_TRUE(IsArithmeticCandidate(text));
  for (const char* text : {"()", "", "12:30", "10 pears", "1e3"}) {
    EXPECT_FALSE(IsArithmeticCandidate(text)) << text;
  }
}

}  // namespace
}  // namespace tarvod
