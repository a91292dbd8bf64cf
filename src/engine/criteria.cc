// Criteria evaluation: one criterion entry of a rule against the event's context.

#include <optional>
#include <string>

#include "engine/keyword_tables.h"
#include "engine/rule_processor.h"
#include "platform/diagnostic_log.h"
#include "platform/directory.h"

namespace tarvod {
namespace {

using plist::Value;

// Outcome of a test: true or false, or nullopt when the operands are of kinds the test has no
// meaning for. Undecided tests fail in both their plain and their negated form ("contains"
// and "notcontains" alike), so that a rule never fires on a comparison that was not made.
using Decision = std::optional<bool>;

std::optional<bool> Negated(Decision d) {
  if (!d) return std::nullopt;
  return !*d;
}

std::string LowerCase(std::string text) {
  for (char& c : text) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  }
  return text;
}

// Values that carry no text or number for these tests: arrays, dictionaries, dates and data.
bool IsStructured(const Value& v) {
  return v.isArray() || v.isDictionary() || v.isDate() || v.isData();
}

// The text a string or group test reads: a string itself, a number or boolean its text form.
std::optional<std::string> TestText(const Value* v) {
  if (v == nullptr || IsStructured(*v)) return std::nullopt;
  return v->textForm();
}

// Three-way numeric comparison; nullopt for operand kinds without a numeric value and for NaN.
// An absent operand counts as 0, as absent values do everywhere else in the daemon. Two
// integers compare exactly (a double would merge integers beyond 2^53).
std::optional<int> CompareNumbers(const Value* a, const Value* b) {
  if ((a != nullptr && IsStructured(*a)) || (b != nullptr && IsStructured(*b))) {
    return std::nullopt;
  }
  if (a != nullptr && b != nullptr && a->isInteger() && b->isInteger()) {
    return a->integer() < b->integer() ? -1 : (a->integer() > b->integer() ? 1 : 0);
  }
  const double x = a ? a->numberValue() : 0.0;
  const double y = b ? b->numberValue() : 0.0;
  if (x < y) return -1;
  if (x > y) return 1;
  if (x == y) return 0;
  return std::nullopt;  // NaN
}

// Values of different kinds are never equal; numbers and booleans are one kind here.
bool Equal(const Value& a, const Value* b) {
  if (b == nullptr) return false;
  if (a.isNumber() && b->isNumber()) return CompareNumbers(&a, b) == 0;
  return a == *b;
}

// Strings order by Unicode code point: comparing their UTF-8 bytes gives that order. Numbers
// order numerically. A string against a number, or any other kind, has no order.
std::optional<int> CompareOrder(const Value& a, const Value* b) {
  if (b == nullptr) return std::nullopt;
  if (a.isString() && b->isString()) {
    const int c = a.string().compare(b->string());
    return c < 0 ? -1 : (c > 0 ? 1 : 0);
  }
  if (a.isNumber() && b->isNumber()) return CompareNumbers(&a, b);
  return std::nullopt;
}

Decision StringTest(int code, const Value& a, const Value* b) {
  const auto first = TestText(&a);
  const auto second = TestText(b);
  if (!first || !second) return std::nullopt;
  switch (code) {
    case 10:
      return first->starts_with(*second);
    case 11:
      return first->ends_with(*second);
    default:  // 12: literal, case-sensitive substring
      return first->find(*second) != std::string::npos;
  }
}

Decision GroupTest(const Value& a, const Value* b) {
  const auto user = TestText(&a);
  const auto group = TestText(b);
  if (!user || !group) return std::nullopt;
  return IsUserInGroup(*user, *group);
}

// "empty": an empty string, or an integer value of 0 (so the texts 0 and abc are empty).
Decision EmptyTest(const Value& a) {
  if (IsStructured(a)) return std::nullopt;
  if (a.isString() && a.string().empty()) return true;
  return a.integerValue() == 0;
}

Decision Decide(int code, const Value& first, const Value* second, Context& context,
                const std::string& filePath) {
  switch (code) {
    case 2:
      return Equal(first, second);
    case 7:
      return !Equal(first, second);
    case 3:
    case 4:
    case 5:
    case 6: {
      // A missing second operand compares as 0.
      const auto c = CompareNumbers(&first, second);
      if (!c) return std::nullopt;
      if (code == 3) return *c > 0;
      if (code == 4) return *c < 0;
      if (code == 5) return *c >= 0;
      return *c <= 0;
    }
    // The group, string and ordering tests below fail, in plain and negated form alike, when
    // the second operand is missing or either operand is an array, dictionary, date or data.
    case 8:
      return GroupTest(first, second);
    case 9:
      return Negated(GroupTest(first, second));
    case 10:
    case 11:
    case 12:
      return StringTest(code, first, second);
    case 13:
      return Negated(StringTest(12, first, second));
    case 14:
    case 15: {
      // A string against a number has no order: both tests fail.
      const auto c = CompareOrder(first, second);
      if (!c) return std::nullopt;
      return code == 14 ? *c < 0 : *c > 0;
    }
    case 16:
    case 17: {
      // The operand names a variable; only a string or a number can be a name.
      const auto name = TestText(&first);
      if (!name) return std::nullopt;
      const bool exists = context.keyExists(*name, filePath);
      return code == 16 ? exists : !exists;
    }
    // "empty" and "notempty" of an array, dictionary, date or data fail both.
    case 18:
      return EmptyTest(first);
    case 19:
      return Negated(EmptyTest(first));
    default:
      return std::nullopt;
  }
}

}  // namespace

bool ProcessCriteria(const plist::Dictionary& criterion, const Rule& rule, Context& context,
                     DryRun* dryRun) {
  static const std::string kNoFile;
  const std::string* path = rule.findString("filePath");
  const std::string& filePath = path ? *path : kNoFile;

  const Value* written = criterion.find("operator");
  std::optional<int> code;
  std::string keyword;
  if (written != nullptr && written->isString()) {
    keyword = LowerCase(written->string());
    code = OperatorCode(keyword);
  }
  if (!code) {
    const std::string shown = written ? written->textForm() : "(null)";
    LogMessage(0, "The operator %s is invalid in the criteria:\n%s", shown.c_str(),
               plist::Describe(criterion).c_str());
    if (dryRun) dryRun->note("  criterion: invalid operator %s: failed", shown.c_str());
    return false;
  }
  if (*code == 0) {
    LogMessage(2, "    Evaluating always-true criteria");
    if (dryRun) dryRun->note("  criterion: true: passed");
    return true;
  }

  plist::Array operands;
  if (const plist::Array* given = criterion.findArray("operands")) {
    ErrorSlot error;
    std::optional<Value> resolved = context.resolveVariablesInArray(*given, filePath, &error);
    if (error) {
      LogMessage(0, "Error: %s", error->description.c_str());
      if (dryRun)
        dryRun->note("  criterion: %s: operands cannot be resolved: failed", keyword.c_str());
      return false;
    }
    if (resolved && resolved->isArray()) operands = std::move(resolved->array());
  }
  if (operands.empty()) {
    LogMessage(0, "Error: Criteria failed because it has no operands for operator %s",
               keyword.c_str());
    if (dryRun) dryRun->note("  criterion: %s without operands: failed", keyword.c_str());
    return false;
  }

  const Value& first = operands[0];
  // The traces' texts are made only when the traces are written.
  const bool tracing = DebugLevel() >= 2;
  if (operands.size() == 1 && tracing) {
    LogMessage(2, "    Evaluating criteria: %s %s", context.shownValue(first).c_str(),
               keyword.c_str());
  }
  // Only the first two operands are used; further ones are ignored.
  const Value* second = nullptr;
  if (*code < 16) {
    second = operands.size() > 1 ? &operands[1] : nullptr;
    if (tracing) {
      LogMessage(2, "    Evaluating criteria: %s %s %s", context.shownValue(first).c_str(),
                 keyword.c_str(), second ? context.shownValue(*second).c_str() : "(null)");
    }
  }
  const bool passed = Decide(*code, first, second, context, filePath).value_or(false);
  if (dryRun) {
    // The kinds are shown: 5 and "5" print alike but are never equal.
    dryRun->note(
        "  criterion: %s (%s) %s %s: %s", context.shownValue(first).c_str(), plist::KindName(first),
        keyword.c_str(),
        second ? (context.shownValue(*second) + " (" + plist::KindName(*second) + ")").c_str() : "",
        passed ? "passed" : "failed");
  }
  return passed;
}

bool IsUserInGroup(const std::string& user, const std::string& group) {
  return UserIsMemberOfGroup(user, group);
}

}  // namespace tarvod
