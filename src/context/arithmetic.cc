#include "context/arithmetic.h"

#include <charconv>
#include <cmath>
#include <cstdint>
#include <limits>
#include <vector>

namespace tarvod {
namespace {

// The evaluator is an operator-precedence parser with explicit stacks on the heap, so that
// deeply nested parentheses or long chains of unary minus cost memory linear in the input and
// never recurse. Each token is pushed and popped at most once: time is linear too.

// An operand stays an exact 64-bit integer while every step is exact; it becomes a double as
// soon as a literal has a fraction, a division leaves a remainder or a step overflows.
struct Number {
  bool isInteger = true;
  int64_t integer = 0;
  double real = 0;

  double asDouble() const { return isInteger ? static_cast<double>(integer) : real; }
  static Number Int(int64_t i) { return Number{true, i, 0}; }
  static Number Real(double d) { return Number{false, 0, d}; }
};

enum class Op : char { kAdd, kSubtract, kMultiply, kDivide, kNegate, kPlus, kOpenParen };

int Precedence(Op op) {
  switch (op) {
    case Op::kAdd:
    case Op::kSubtract:
      return 1;
    case Op::kMultiply:
    case Op::kDivide:
      return 2;
    case Op::kNegate:
    case Op::kPlus:
      return 3;
    case Op::kOpenParen:
      return 0;
  }
  return 0;
}

bool IsUnary(Op op) { return op == Op::kNegate || op == Op::kPlus; }

bool IsBlank(char c) { return c == ' ' || c == '\t' || c == '\n'; }
bool IsDigit(char c) { return c >= '0' && c <= '9'; }

// Results outside the doubles' finite range are failures, not infinities stored as values.
std::optional<Number> Checked(double d) {
  if (!std::isfinite(d)) return std::nullopt;
  return Number::Real(d);
}

std::optional<Number> Negate(const Number& a) {
  if (a.isInteger) {
    if (a.integer != std::numeric_limits<int64_t>::min()) return Number::Int(-a.integer);
    return Number::Real(-static_cast<double>(a.integer));
  }
  return Number::Real(-a.real);
}

class Evaluator {
 public:
  explicit Evaluator(std::string_view text) : mText(text) {}

  ArithmeticResult run() {
    if (!parse()) return {std::nullopt, mFailure};
    Number n = mValues.back();
    // An integral result in the 64-bit range is an integer, whatever path produced it.
    if (!n.isInteger && n.real == std::trunc(n.real) && n.real >= -9223372036854775808.0 &&
        n.real < 9223372036854775808.0) {
      n = Number::Int(static_cast<int64_t>(n.real));
    }
    if (n.isInteger) return {plist::Value::Integer(n.integer), {}};
    return {plist::Value::Real(n.real), {}};
  }

 private:
  bool fail(std::string why) {
    mFailure = std::move(why);
    return false;
  }
  bool failAt(const char* what, size_t position) {
    // The caller's message already shows the expression; the offset says where it broke.
    return fail(std::string(what) + " at offset " + std::to_string(position));
  }

  bool parse() {
    bool expectOperand = true;
    size_t i = 0;
    while (i < mText.size()) {
      const char c = mText[i];
      if (IsBlank(c)) {
        ++i;
        continue;
      }
      if (expectOperand) {
        if (IsDigit(c) || c == '.') {
          if (!readNumber(i)) return false;
          expectOperand = false;
        } else if (c == '-') {
          mOps.push_back(Op::kNegate);
          ++i;
        } else if (c == '+') {
          mOps.push_back(Op::kPlus);
          ++i;
        } else if (c == '(') {
          mOps.push_back(Op::kOpenParen);
          ++i;
        } else {
          return failAt("expected a number or \"(\"", i);
        }
        continue;
      }
      if (c == ')') {
        while (!mOps.empty() && mOps.back() != Op::kOpenParen) {
          if (!applyTop()) return false;
        }
        if (mOps.empty()) return failAt("unbalanced \")\"", i);
        mOps.pop_back();
        ++i;
        continue;
      }
      Op op;
      switch (c) {
        case '+':
          op = Op::kAdd;
          break;
        case '-':
          op = Op::kSubtract;
          break;
        case '*':
          op = Op::kMultiply;
          break;
        case '/':
          op = Op::kDivide;
          break;
        default:
          return failAt("expected an operator or \")\"", i);
      }
      // Left associative: apply everything of the same or higher precedence first.
      while (!mOps.empty() && mOps.back() != Op::kOpenParen &&
             Precedence(mOps.back()) >= Precedence(op)) {
        if (!applyTop()) return false;
      }
      mOps.push_back(op);
      expectOperand = true;
      ++i;
    }
    if (mValues.empty() && mOps.empty()) return fail("empty expression");
    if (expectOperand) return failAt("expression ends where a number was expected", i);
    while (!mOps.empty()) {
      if (mOps.back() == Op::kOpenParen) return fail("unbalanced \"(\"");
      if (!applyTop()) return false;
    }
    if (mValues.size() != 1) return fail("malformed expression");
    return true;
  }

  // Digits with an optional fraction, or a fraction alone (".5"); no exponent.
  bool readNumber(size_t& i) {
    const size_t start = i;
    size_t digits = 0;
    bool fraction = false;
    while (i < mText.size() && IsDigit(mText[i])) ++i, ++digits;
    if (i < mText.size() && mText[i] == '.') {
      fraction = true;
      ++i;
      while (i < mText.size() && IsDigit(mText[i])) ++i, ++digits;
    }
    if (digits == 0) return failAt("a number needs at least one digit", start);
    const char* first = mText.data() + start;
    const char* last = mText.data() + i;
    if (!fraction) {
      int64_t value = 0;
      auto [ptr, ec] = std::from_chars(first, last, value);
      if (ec == std::errc() && ptr == last) {
        mValues.push_back(Number::Int(value));
        return true;
      }
    }
    double value = 0;
    auto [ptr, ec] = std::from_chars(first, last, value, std::chars_format::fixed);
    if (ec != std::errc() || ptr != last || !std::isfinite(value)) {
      return failAt("number out of range", start);
    }
    mValues.push_back(Number::Real(value));
    return true;
  }

  bool applyTop() {
    const Op op = mOps.back();
    mOps.pop_back();
    if (IsUnary(op)) {
      if (mValues.empty()) return fail("malformed expression");
      if (op == Op::kNegate) {
        auto negated = Negate(mValues.back());
        if (!negated) return fail("result out of range");
        mValues.back() = *negated;
      }
      return true;
    }
    if (mValues.size() < 2) return fail("malformed expression");
    const Number b = mValues.back();
    mValues.pop_back();
    const Number a = mValues.back();
    auto result = Binary(op, a, b);
    if (!result) return false;
    mValues.back() = *result;
    return true;
  }

  std::optional<Number> Binary(Op op, const Number& a, const Number& b) {
    if (op == Op::kDivide && (b.isInteger ? b.integer == 0 : b.real == 0.0)) {
      fail("division by zero");
      return std::nullopt;
    }
    if (a.isInteger && b.isInteger) {
      int64_t r = 0;
      bool overflow = false;
      switch (op) {
        case Op::kAdd:
          overflow = __builtin_add_overflow(a.integer, b.integer, &r);
          break;
        case Op::kSubtract:
          overflow = __builtin_sub_overflow(a.integer, b.integer, &r);
          break;
        case Op::kMultiply:
          overflow = __builtin_mul_overflow(a.integer, b.integer, &r);
          break;
        case Op::kDivide:
          // INT64_MIN / -1 overflows; an inexact quotient becomes a real.
          overflow = a.integer == std::numeric_limits<int64_t>::min() && b.integer == -1;
          if (!overflow && a.integer % b.integer == 0) {
            r = a.integer / b.integer;
          } else {
            overflow = true;
          }
          break;
        default:
          break;
      }
      if (!overflow) return Number::Int(r);
    }
    const double x = a.asDouble();
    const double y = b.asDouble();
    std::optional<Number> r;
    switch (op) {
      case Op::kAdd:
        r = Checked(x + y);
        break;
      case Op::kSubtract:
        r = Checked(x - y);
        break;
      case Op::kMultiply:
        r = Checked(x * y);
        break;
      case Op::kDivide:
        r = Checked(x / y);
        break;
      default:
        break;
    }
    if (!r) fail("result out of range");
    return r;
  }

  std::string_view mText;
  std::vector<Number> mValues;
  std::vector<Op> mOps;
  std::string mFailure;
};

}  // namespace

ArithmeticResult EvaluateArithmetic(std::string_view expression) {
  return Evaluator(expression).run();
}

bool IsArithmeticCandidate(std::string_view text) {
  bool digit = false;
  for (char c : text) {
    if (IsDigit(c)) {
      digit = true;
      continue;
    }
    switch (c) {
      case '.':
      case ' ':
      case '\t':
      case '\n':
      case '+':
      case '-':
      case '/':
      case '*':
      case '(':
      case ')':
        break;
      default:
        return false;
    }
  }
  return digit;
}

}  // namespace tarvod
