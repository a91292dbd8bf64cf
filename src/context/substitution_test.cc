#include <gtest/gtest.h>

#include "context/context.h"
#include "platform/diagnostic_log.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Array;
using plist::Dictionary;
using plist::Value;

constexpr const char* kFile = "/etc/tarvod.d/rules/s.plist";

class SubstitutionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    SetDebugLevel(6);
    variables_ = std::make_shared<VariableStore>(VariableStore{
        {kGlobalsKey, Dictionary{}},
        {kFile, Dictionary{{"h", "alpha"},
                           {"n", Value::Integer(5)},
                           {"b", "1"},
                           {"a1", "one"},
                           {"loop", "${h}"},
                           {"kk", "key"},
                           {"list", Array{"p", "q"}}}},
    });
    context_ = std::make_unique<Context>(variables_, std::make_shared<Rulebase>());
  }
  std::string Log() const { return capture_.text(); }
  testing::LogCapture capture_;
  VariableStorePtr variables_;
  std::unique_ptr<Context> context_;
};

TEST_F(SubstitutionTest, ReferencesAreReplacedByTheirValues) {
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

TEST_F(SubstitutionTest, TokensAndValuesAreLoggedAtLevelFour) {
  EXPECT_EQ(context_->resolveVariablesInString("<${h}${u}>", kFile, nullptr), Value("<alpha0>"));
  EXPECT_EQ(Log(), "tokenName is h\ntokenValue is alpha\ntokenName is u\ntokenValue is (null)\n");
}

TEST_F(SubstitutionTest, MalformedTextFailsWithEveryMessage) {
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

TEST_F(SubstitutionTest, ASuccessLeavesTheSlotAsItWas) {
  ErrorSlot error = SubstitutionError{.description = "earlier"};
  EXPECT_EQ(context_->resolveVariablesInString("${h}!", kFile, &error), Value("alpha!"));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->description, "earlier");
  EXPECT_EQ(context_->resolveVariablesInString("${h", kFile, nullptr), std::nullopt);
}

TEST_F(SubstitutionTest, LongTextsWithManyReferencesResolve) {
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

TEST_F(SubstitutionTest, ArraysOmitAbsentElementsAndFailOnErrors) {
  struct Case {
    Array array;
    std::optional<Value> expected;
    bool error;
  };
  const Case cases[] = {
      {{}, Value(Array{}), false},
      {{"${x}", "b"}, Value(Array{"b"}), false},
      {{"${x", "b"}, std::nullopt, true},
      {{"b", "${x"}, Value(Array{"b"}), true},  // the slot tells the caller
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
  EXPECT_NE(Log().find("The array object ${x} could not be resolved and was omitted.\n"),
            std::string::npos);
  EXPECT_EQ(context_->resolveVariablesInArray(Array{"${x", "b"}, kFile, nullptr), std::nullopt);
}

TEST_F(SubstitutionTest, DictionariesResolveKeysAndValues) {
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

TEST_F(SubstitutionTest, OtherValuesResolveAsTheirTextForm) {
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

TEST_F(SubstitutionTest, DeepCollectionsResolveUpToTheLimitAndFailBeyondIt) {
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
