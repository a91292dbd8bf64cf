#include <gtest/gtest.h>

#include "context/context.h"
#include "platform/diagnostic_log.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Array;
using plist::Dictionary;
using plist::Value;

constexpr const char* kFile = "/etc/tarvod.d/rules/a.plist";

class LookupTest : public ::testing::Test {
 protected:
  void SetUp() override {
    SetDebugLevel(0);
    variables_ = std::make_shared<VariableStore>(VariableStore{
        {kGlobalsKey, Dictionary{{"g", "global value"}, {"shared", "from globals"}}},
        {kFile, Dictionary{{"x", Value::Real(3.7)},
                           {"name", "alpha"},
                           {"x ", "with blank"},
                           {"a%b", Value::Integer(7)},
                           {R"(a\:b)", "escaped colon"},
                           {"empty", ""},
                           {"n", Value::Integer(5)},
                           {"prefix", "x"}}},
    });
    context_ = std::make_unique<Context>(
        variables_, std::make_shared<Rulebase>(),
        Dictionary{{"eventType", "auth.failure"},
                   {"eventDetails", Dictionary{{"time", "12:30"}, {"count", Value::Integer(3)}}}});
    context_->eventMetadata().set("auth.failure:eventCounter", Value::Integer(4));
    context_->eventMetadata().set("auth.failure:lastEventTimestamp", Value::Real(0));
    SetDebugLevel(6);
  }
  std::string Log() const { return capture_.text(); }
  const Value* Local(std::string_view name) {
    const Dictionary* file = variables_->findDictionary(kFile);
    return file ? file->find(name) : nullptr;
  }
  testing::LogCapture capture_;
  VariableStorePtr variables_;
  std::unique_ptr<Context> context_;
};

TEST_F(LookupTest, ReferencesFindTheirNamespaceAndApplyTheirSuffix) {
  const std::string referenceDate = plist::FormatDate(plist::Date{0}, false);
  struct Case {
    std::string reference, rulesFile;
    std::optional<Value> expected;
  };
  const Case cases[] = {
      {"x", kFile, Value::Real(3.7)},
      {"x %5.1f", kFile, Value("  3.7")},  // name and suffix are trimmed
      {" x\t%d\n", kFile, Value("3")},
      {"x\u00a0%d", kFile, Value("3")},    // Unicode white space is trimmed too
      {"a%b%d", kFile, Value("7")},        // the suffix starts at the last "%"
      {"x ", kFile, Value("with blank")},  // without "%" the name is taken as written
      {"x%", kFile, Value::Real(3.7)},     // a lone "%" is an empty suffix
      {"missing%d", kFile, Value("0")},    // absent counts as 0 for a converting suffix
      {"missing", kFile, std::nullopt},
      {"", kFile, std::nullopt},
      {"g", kFile, std::nullopt},  // no fallback from file-local to global
      {"global:g", kFile, Value("global value")},
      {"global:g", "", Value("global value")},
      {"x", "", std::nullopt},  // a plain name needs a rules file
      {"x", "/other.plist", std::nullopt},
      {R"(a\:b)", kFile, Value("escaped colon")},
      {"event:eventType", "", Value("auth.failure")},
      {"event:time", "", Value(R"(12\:30)")},
      {"event:count%d", "", Value("3")},
      {"event:eventDetails", "", std::nullopt},
      {"auth.failure:eventCounter", "", Value::Integer(4)},
      {"auth.failure:lastEventTimestamp%t", "", Value(referenceDate)},
      {"a:b", kFile, std::nullopt},  // metadata, not the file-local "a\:b"
      {"keychain:root@mail.example.com", "", std::nullopt},
      {"builtin:event", "", Value(plist::Describe(*context_->event()))},
      {"builtin:unknown", "", std::nullopt},
      {"Global:g", kFile, std::nullopt},  // prefixes are case-sensitive
  };
  for (const Case& c : cases) {
    EXPECT_EQ(context_->variableValueForKey(c.reference, c.rulesFile), c.expected)
        << "reference «" << c.reference << "»";
  }
  EXPECT_EQ(Log(), "");  // lookups log nothing themselves
}

TEST_F(LookupTest, EventReferencesOfAContextWithoutAnEventHaveNoValue) {
  Context context(variables_, std::make_shared<Rulebase>());
  EXPECT_EQ(context.variableValueForKey("event:eventType", kFile), std::nullopt);
  EXPECT_EQ(context.variableValueForKey("builtin:eventDictionary", kFile), std::nullopt);
  EXPECT_EQ(context.variableValueForKey("builtin:event", kFile), std::nullopt);
  EXPECT_EQ(context.variableValueForKey("x", kFile), Value::Real(3.7));
}

TEST_F(LookupTest, ExistenceFollowsLookupAndIsLoggedAtLevelSix) {
  EXPECT_TRUE(context_->keyExists("empty", kFile));  // an empty string is a value
  EXPECT_FALSE(context_->keyExists("missing", kFile));
  EXPECT_TRUE(context_->keyExists("missing%d", kFile));
  EXPECT_EQ(Log(),
            "KeyExists: empty exists in the datastore\n"
            "KeyExists: missing does not exist in the datastore\n"
            "KeyExists: missing%d exists in the datastore\n");
}

TEST_F(LookupTest, AssignedStringsBecomeNumbersOnlyWhenPurelyArithmetic) {
  struct Case {
    Value given;
    std::optional<Value> stored;
  };
  const Case cases[] = {
      {Value("3 * (2 + 1)"), Value::Integer(9)},
      {Value("-2.5"), Value::Real(-2.5)},
      {Value("1 2"), Value("1 2")},           // fails to evaluate, kept as text
      {Value("12:30"), Value("12:30")},       // not arithmetic at all
      {Value("${undefined}"), std::nullopt},  // a whole-text reference without value removes
      {Value("x${undefined}"), Value("x0")},
      {Value("${name}"), Value("alpha")},
      {Value("${n}"), Value::Integer(5)},  // the referenced value itself, not its text
      {Value("${n} + 1"), Value::Integer(6)},
      {Value::Integer(5), Value::Integer(5)},
      {Value::Boolean(true), Value::Boolean(true)},
      {Value::FromDate(plist::Date{12}), Value::FromDate(plist::Date{12})},
      {Value(Array{"${name}", "42"}), Value(Array{"${name}", "42"})},  // stored unchanged
      {Value(Dictionary{{"k", "${name}"}}), Value(Dictionary{{"k", "${name}"}})},
  };
  for (const Case& c : cases) {
    context_->setVariableValue(Value("previous"), "v", kFile);
    context_->setVariableValue(c.given, "v", kFile);
    const Value* stored = Local("v");
    EXPECT_EQ(stored ? std::optional<Value>(*stored) : std::nullopt, c.stored)
        << "given " << c.given.textForm();
  }
}

TEST_F(LookupTest, FailuresKeepTheStringOrThePreviousValueAndAreLogged) {
  context_->setVariableValue(Value("${name"), "name", kFile);
  EXPECT_EQ(*Local("name"), Value("alpha"));
  context_->setVariableValue(Value("1 2"), "v", kFile);
  EXPECT_EQ(*Local("v"), Value("1 2"));
  const std::string log = Log();
  EXPECT_NE(log.find("Error: Unterminated token starting at index 0 in string: ${name\n"),
            std::string::npos);
  EXPECT_NE(log.find("initial value = 1 2\n"
                     "after resolveVarsInString value = 1 2\n"
                     "Exception thrown while evaluating expression: 1 2\n"),
            std::string::npos)
      << log;
  EXPECT_NE(log.find("\n\n  Set variable: v = 1 2\n"), std::string::npos) << log;
}

TEST_F(LookupTest, NamesAreResolvedCheckedAndScoped) {
  context_->setVariableValue(Value("1"), "${prefix}count", kFile);
  EXPECT_EQ(*Local("xcount"), Value::Integer(1));

  context_->setVariableValue(Value("2"), R"(a\:b)", kFile);
  EXPECT_EQ(*Local(R"(a\:b)"), Value::Integer(2));

  context_->setVariableValue(Value("3"), "global:fresh", kFile);
  EXPECT_EQ(*variables_->findDictionary(kGlobalsKey)->find("fresh"), Value::Integer(3));
  EXPECT_EQ(Local("fresh"), nullptr);
  EXPECT_EQ(Local("global:fresh"), nullptr);

  context_->setVariableValue(Value("4"), "newfile", "/new.plist");
  EXPECT_EQ(*variables_->findDictionary("/new.plist")->find("newfile"), Value::Integer(4));
}

TEST_F(LookupTest, RefusedNamesStoreNothingAndSayWhy) {
  struct Case {
    std::string name, rulesFile, message;
  };
  const Case cases[] = {
      {"a:b", kFile, "Variable names cannot contain \":\" - skipping a:b\n"},
      {"global:a:b", kFile, "Variable names cannot contain \":\" - skipping a:b\n"},
      {"${n}", kFile, "tokenName is n\nThe variable name 5 is not a string. Skipping.\n"},
      {"${undefined}", kFile,
       "tokenName is undefined\nThe variable name (null) is not a string. Skipping.\n"},
      {"v${", kFile,
       "Errors occurred resolving variables in string v${:\n"
       "Unterminated token starting at index 1 in string: v${\n"
       "Error: Unterminated token starting at index 1 in string: v${\n"},
      {"plain", "",
       "initial value = 9\n"
       "after resolveVarsInString value = 9\n"
       "Cannot set file local variable plain because the file path is nil\n"
       "  Set variable: plain = 9\n"},
  };
  for (const Case& c : cases) {
    const VariableStore before = *variables_;
    const std::string logBefore = Log();
    context_->setVariableValue(Value("9"), c.name, c.rulesFile);
    EXPECT_EQ(*variables_, before) << c.name;
    EXPECT_EQ(Log().substr(logBefore.size()), c.message) << c.name;
  }
}

TEST_F(LookupTest, AssignmentsAreVisibleToEveryContextOfTheStore) {
  Context other(variables_, std::make_shared<Rulebase>());
  other.setVariableValue(Value("${name} and more"), "global:copied", kFile);
  EXPECT_EQ(context_->variableValueForKey("global:copied", ""), Value("alpha and more"));
  other.setVariableValue(std::nullopt, "global:copied", kFile);
  EXPECT_EQ(context_->variableValueForKey("global:copied", ""), std::nullopt);

  // A store without globals gets them at the first global assignment.
  Context bare(std::make_shared<VariableStore>(), std::make_shared<Rulebase>());
  bare.setVariableValue(Value("1"), "global:g", "");
  EXPECT_EQ(bare.variableValueForKey("global:g", ""), Value::Integer(1));
}

}  // namespace
}  // namespace tarvod
