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

class VariablesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    SetDebugLevel(0);
    variables_ = std::make_shared<VariableStore>(VariableStore{
        {kGlobalsKey, Dictionary{{"g", "global value"}, {"shared", "from globals"}}},
        {kFile, Dictionary{{"x", Value::Real(3.7)},
                           {"name", "alpha"},
                           {"h", "alpha"},
                           {"b", "1"},
                           {"a1", "one"},
                           {"loop", "${h}"},
                           {"kk", "key"},
                           {"list", Array{"p", "q"}},
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

TEST_F(VariablesTest, ReferencesFindTheirNamespaceAndApplyTheirSuffix) {
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

TEST_F(VariablesTest, EventReferencesOfAContextWithoutAnEventHaveNoValue) {
  Context context(variables_, std::make_shared<Rulebase>());
  EXPECT_EQ(context.variableValueForKey("event:eventType", kFile), std::nullopt);
  EXPECT_EQ(context.variableValueForKey("builtin:eventDictionary", kFile), std::nullopt);
  EXPECT_EQ(context.variableValueForKey("builtin:event", kFile), std::nullopt);
  EXPECT_EQ(context.variableValueForKey("x", kFile), Value::Real(3.7));
}

TEST_F(VariablesTest, ExistenceFollowsLookupAndIsLoggedAtLevelSix) {
  EXPECT_TRUE(context_->keyExists("empty", kFile));  // an empty string is a value
  EXPECT_FALSE(context_->keyExists("missing", kFile));
  EXPECT_TRUE(context_->keyExists("missing%d", kFile));
  EXPECT_EQ(Log(),
            "KeyExists: empty exists in the datastore\n"
            "KeyExists: missing does not exist in the datastore\n"
            "KeyExists: missing%d exists in the datastore\n");
}

TEST_F(VariablesTest, AssignedStringsBecomeNumbersOnlyWhenPurelyArithmetic) {
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
      {Value("${n}"), Value::Integer(5)},     // the referenced value itself, not its text
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

TEST_F(VariablesTest, FailuresKeepTheStringOrThePreviousValueAndAreLogged) {
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

TEST_F(VariablesTest, NamesAreResolvedCheckedAndScoped) {
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

TEST_F(VariablesTest, RefusedNamesStoreNothingAndSayWhy) {
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

TEST_F(VariablesTest, AssignmentsAreVisibleToEveryContextOfTheStore) {
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

TEST_F(VariablesTest, ReferencesAreReplacedByTheirValues) {
  struct Case {
    std::string text;
    std::optional<Value> expected;
  };
  const Case cases[] = {
      {"ab", Value("ab")},  // too short to hold a reference
      {"${", Value("${")},
      {"${}", std::nullopt},
      {"a${}b", Value("a0b")},
      {"Host ${h} down", Value("Host alpha down")},
      {"Host ${u} down", Value("Host 0 down")},
      {"${n}", Value::Integer(5)},  // a whole-text reference gives the value itself
      {"${list}", Value(Array{"p", "q"})},
      {"${u}", std::nullopt},
      {"x${n}", Value("x5")},
      {"${h}${h}", Value("alphaalpha")},
      {"${h}}", Value("alpha}")},
      {R"(\${h})", Value(R"(\${h})")},     // the escape and the reference text stay
      {R"(\\${h})", Value(R"(\\alpha)")},  // an even run escapes nothing
      {R"(${h\}})", std::nullopt},         // the escaped brace belongs to the name "h\}"
      {"${a${b}}", Value("one")},          // inner first, then the whole outer reference
      {"<${a${b}}>", Value("<one>")},
      {"${loop}", Value("${h}")},  // a value is never substituted again
      {"<${loop}>", Value("<${h}>")},
      {"cost $5 } and $", Value("cost $5 } and $")},
      {"é ${h} ü", Value("é alpha ü")},
      {"${n%d}", Value("5")},
      {"${global:missing%d}!", Value("0!")},
  };
  for (const Case& c : cases) {
    ErrorSlot error;
    EXPECT_EQ(context_->resolveVariablesInString(c.text, kFile, &error), c.expected)
        << "text «" << c.text << "»";
    EXPECT_FALSE(error) << c.text;
  }
}

TEST_F(VariablesTest, TokensAndValuesAreLoggedAtLevelFour) {
  EXPECT_EQ(context_->resolveVariablesInString("<${h}${u}>", kFile, nullptr), Value("<alpha0>"));
  EXPECT_EQ(Log(), "tokenName is h\ntokenValue is alpha\ntokenName is u\ntokenValue is (null)\n");
}

TEST_F(VariablesTest, MalformedTextFailsWithEveryMessage) {
  const std::string six = "${a${b${c${d${e${f}}}}}}";
  std::string braces;
  for (size_t i = 0; i < 1'000'000; ++i) braces += "${";
  // Every unterminated "${", innermost first, after the nesting message when there is one.
  struct Case {
    std::string text;
    bool tooDeep;
    std::vector<int> unterminatedAt;
  };
  const Case cases[] = {
      {"price: ${p", false, {7}},
      {"${a${b", false, {3, 0}},
      // Positions count UTF-16 code units of the text as it stands after earlier replacements.
      {"é${p", false, {1}},
      {"\U0001F600${p", false, {2}},
      {"${h}é${p", false, {6}},
      {six, true, {12, 9, 6, 3, 0}},
      {braces, true, {8, 6, 4, 2, 0}},
  };
  for (const Case& c : cases) {
    std::string expected;
    if (c.tooDeep) {
      expected = "String exceeded the maximum allowable levels of variable nesting (5): " + c.text;
    }
    for (int at : c.unterminatedAt) {
      expected += (expected.empty() ? "" : "\n") + ("Unterminated token starting at index " +
                                                    std::to_string(at) + " in string: " + c.text);
    }
    ErrorSlot error;
    EXPECT_EQ(context_->resolveVariablesInString(c.text, kFile, &error), std::nullopt);
    ASSERT_TRUE(error) << c.text.substr(0, 40);
    EXPECT_EQ(error->domain, "com.quenta.tarvod");
    EXPECT_EQ(error->code, 1);
    EXPECT_TRUE(error->description == expected) << error->description.substr(0, 400);
  }
  const std::string log = Log();
  EXPECT_NE(log.find("Errors occurred resolving variables in string price: ${p:\n"
                     "Unterminated token starting at index 7 in string: price: ${p\n"),
            std::string::npos);
}

TEST_F(VariablesTest, ASuccessLeavesTheSlotAsItWas) {
  ErrorSlot error = SubstitutionError{.description = "earlier"};
  EXPECT_EQ(context_->resolveVariablesInString("${h}!", kFile, &error), Value("alpha!"));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->description, "earlier");
  EXPECT_EQ(context_->resolveVariablesInString("${h", kFile, nullptr), std::nullopt);
}

TEST_F(VariablesTest, LongTextsWithManyReferencesResolve) {
  SetDebugLevel(0);
  std::string text;
  for (int i = 0; i < 200'000; ++i) text += "${h} ";
  const auto resolved = context_->resolveVariablesInString(text, kFile, nullptr);
  ASSERT_TRUE(resolved && resolved->isString());
  EXPECT_EQ(resolved->string().size(), 200'000u * 6);
  const std::string plain(8'000'000, 'x');
  EXPECT_EQ(context_->resolveVariablesInString(plain, kFile, nullptr), Value(plain));
  const std::string dollars(2'000'000, '$');
  EXPECT_EQ(context_->resolveVariablesInString(dollars, kFile, nullptr), Value(dollars));
}

TEST_F(VariablesTest, ArraysOmitAbsentElementsAndFailOnErrors) {
  struct Case {
    Array array;
    std::optional<Value> expected;
    bool error;
  };
  const Case cases[] = {
      {{}, Value(Array{}), false},
      {{"${u}", "b"}, Value(Array{"b"}), false},
      {{"${u", "b"}, std::nullopt, true},
      {{"b", "${u"}, Value(Array{"b"}), true},  // the slot tells the caller
      {{Value::Integer(5), Value::Boolean(true)},
       Value(Array{"5", Value::Boolean(true).textForm()}),
       false},
      {{"${n}", Array{"${h}", Dictionary{{"${kk}", "${h}"}}}},
       Value(Array{Value::Integer(5), Array{"alpha", Dictionary{{"key", "alpha"}}}}),
       false},
  };
  for (const Case& c : cases) {
    ErrorSlot error;
    EXPECT_EQ(context_->resolveVariablesInArray(c.array, kFile, &error), c.expected)
        << plist::Describe(Value(c.array));
    EXPECT_EQ(error.has_value(), c.error) << plist::Describe(Value(c.array));
  }
  EXPECT_NE(Log().find("The array object ${u} could not be resolved and was omitted.\n"),
            std::string::npos);
  EXPECT_EQ(context_->resolveVariablesInArray(Array{"${u", "b"}, kFile, nullptr), std::nullopt);
}

TEST_F(VariablesTest, DictionariesResolveKeysAndValues) {
  struct Case {
    Dictionary dictionary;
    std::optional<Value> expected;
    std::string error;
  };
  const Case cases[] = {
      {{}, std::nullopt, ""},
      {{{"${kk}", "${h}"}, {"n", "${n}"}},
       Value(Dictionary{{"key", "alpha"}, {"n", Value::Integer(5)}}),
       ""},
      {{{"a", "${u}"}, {"b", "1"}}, Value(Dictionary{{"b", "1"}}), ""},  // absent value: left out
      {{{"${k}", "v"}}, std::nullopt, "The dictionary key ${k} could not be resolved"},
      {{{"a", "${h"}}, std::nullopt, "Unterminated token starting at index 0 in string: ${h"},
      {{{"${n}", "five"}}, Value(Dictionary{{"5", "five"}}), ""},
      {{{"${kk}", "1"}, {"key", "2"}}, Value(Dictionary{{"key", "2"}}), ""},
  };
  for (const Case& c : cases) {
    ErrorSlot error;
    EXPECT_EQ(context_->resolveVariablesInDictionary(c.dictionary, kFile, &error), c.expected)
        << plist::Describe(c.dictionary);
    EXPECT_EQ(error ? error->description : "", c.error) << plist::Describe(c.dictionary);
  }
  const std::string log = Log();
  EXPECT_NE(log.find("The dictionary value ${u} could not be resolved\n"), std::string::npos);
  EXPECT_NE(log.find("\nThe dictionary key ${k} could not be resolved\n"), std::string::npos);
  EXPECT_NE(log.find("\nError: Unterminated token starting at index 0 in string: ${h\n"),
            std::string::npos);
}

TEST_F(VariablesTest, OtherValuesResolveAsTheirTextForm) {
  EXPECT_EQ(context_->resolveVariablesInObject(Value::Integer(5), kFile, nullptr), Value("5"));
  EXPECT_EQ(context_->resolveVariablesInObject(Value("${h}"), kFile, nullptr), Value("alpha"));
  const Value date = Value::FromDate(plist::Date{0});
  EXPECT_EQ(context_->resolveVariablesInObject(date, kFile, nullptr), Value(date.textForm()));
}

Value Nested(int depth, bool dictionaries, const char* leaf) {
  Value value(leaf);
  for (int i = 0; i < depth; ++i) {
    value =
        dictionaries ? Value(Dictionary{{"k", std::move(value)}}) : Value(Array{std::move(value)});
  }
  return value;
}

TEST_F(VariablesTest, DeepCollectionsResolveUpToTheLimitAndFailBeyondIt) {
  SetDebugLevel(0);
  for (const bool dictionaries : {false, true}) {
    ErrorSlot error;
    EXPECT_EQ(context_->resolveVariablesInObject(Nested(256, dictionaries, "${h}"), kFile, &error),
              Nested(256, dictionaries, "alpha"));
    EXPECT_FALSE(error);

    context_->resolveVariablesInObject(Nested(300, dictionaries, "${h}"), kFile, &error);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->description, "Value exceeded the maximum allowable levels of nesting (256)");
  }
}

}  // namespace
}  // namespace tarvod
