#include "context/context.h"

#include <gtest/gtest.h>

#include <fstream>

#include "context/builtins.h"
#include "platform/diagnostic_log.h"
#include "platform/host_stats.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Dictionary;
using plist::Value;

class ContextTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = capture_.directory();
    SetDebugLevel(6);
  }
  void TearDown() override { SetMeminfoPathForTesting(""); }
  std::string Log() const { return capture_.text(); }
  void WriteMeminfo(int freeKb) {
    std::ofstream(dir_ + "/meminfo")
        << "MemFree: " << freeKb << " kB\nActive: 16 kB\nInactive: 32 kB\nUnevictable: 64 kB\n";
    SetMeminfoPathForTesting(dir_ + "/meminfo");
  }
  testing::LogCapture capture_;
  std::string dir_;
};

TEST(ColonEscapes, FollowTheOddBackslashRunConvention) {
  struct Case {
    std::string text, escaped, unescaped;
    bool hasUnescapedColon;
  };
  const Case cases[] = {
      {"", "", "", false},
      {"abc", "abc", "abc", false},
      {"12:30", R"(12\:30)", "12:30", true},
      {R"(12\:30)", R"(12\:30)", "12:30", false},
      {"a:b:c", R"(a\:b\:c)", "a:b:c", true},
      {"é::", R"(é\:\:)", "é::", true},
      {R"(a\\:b)", R"(a\\\:b)", R"(a\\:b)", true},
      {R"(a\\\:b)", R"(a\\\:b)", R"(a\\:b)", false},
      {":", R"(\:)", ":", true},
      {R"(\x:)", R"(\x\:)", R"(\x:)", true},  // a backslash's flag is cleared by the next character
      {R"(end\)", R"(end\)", R"(end\)", false},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(EscapeColonsInEventString(c.text), c.escaped) << c.text;
    EXPECT_EQ(UnescapeColonsInString(c.text), c.unescaped) << c.text;
    EXPECT_EQ(UnescapedColonsInString(c.text), c.hasUnescapedColon) << c.text;
    // Unescaping undoes escaping of text without escaped colons.
    if (c.text != c.unescaped) continue;
    EXPECT_FALSE(UnescapedColonsInString(c.escaped)) << c.text;
    EXPECT_EQ(UnescapeColonsInString(c.escaped), c.text);
  }
}

TEST_F(ContextTest, ImportLiftsDetailsEscapesTheirStringsAndKeepsTopLevelValues) {
  const Dictionary incoming{
      {"eventType", "auth.failure"},
      {"eventSource", "a:b"},
      {"eventDetails", Dictionary{{"time", "12:30"},
                                  {"count", Value::Integer(3)},
                                  {"list", plist::Array{"x:y"}},
                                  {"eventType", "from.details"}}},
  };
  const Dictionary before = incoming;
  Context context(std::make_shared<VariableStore>(), std::make_shared<Rulebase>(), incoming);
  ASSERT_NE(context.event(), nullptr);
  const Dictionary& event = *context.event();
  EXPECT_EQ(*event.findString("time"), R"(12\:30)");
  EXPECT_EQ(*event.find("count"), Value::Integer(3));
  EXPECT_EQ(*event.find("list"), Value(plist::Array{"x:y"}));  // not descended into
  EXPECT_EQ(*event.findString("eventType"), "auth.failure");   // top level wins
  EXPECT_EQ(*event.findString("eventSource"), "a:b");          // top level is not escaped
  EXPECT_FALSE(event.contains("eventDetails"));
  EXPECT_EQ(event.size(), 5u);
  EXPECT_EQ(incoming, before);
  EXPECT_EQ(Log(),
            "key = time before escape 12:30\nafter escape 12\\:30\n"
            "key = eventType before escape from.details\nafter escape from.details\n");
}

TEST_F(ContextTest, EventsWithoutUsableDetailsImportTheirTopLevelOnly) {
  const Dictionary cases[] = {
      {{"eventType", "a"}},
      {{"eventType", "a"}, {"eventDetails", "not a dictionary"}},
  };
  for (const Dictionary& incoming : cases) {
    Context context(std::make_shared<VariableStore>(), std::make_shared<Rulebase>(), incoming);
    ASSERT_NE(context.event(), nullptr);
    EXPECT_EQ(*context.event(), (Dictionary{{"eventType", "a"}}));
  }
  Context without(std::make_shared<VariableStore>(), std::make_shared<Rulebase>());
  EXPECT_EQ(without.event(), nullptr);
  EXPECT_TRUE(without.eventMetadata().empty());
}

TEST_F(ContextTest, ImportOfAnEventWithManyKeysKeepsEveryKeyOnce) {
  std::vector<Dictionary::Entry> details, top;
  for (int i = 0; i < 20000; ++i) {
    details.emplace_back("k" + std::to_string(i), Value("d"));
    top.emplace_back("k" + std::to_string(i * 2), Value("t"));
  }
  top.emplace_back("eventDetails", Value(Dictionary::FromEntries(details)));
  SetDebugLevel(0);
  Context context(std::make_shared<VariableStore>(), std::make_shared<Rulebase>(),
                  Dictionary::FromEntries(top));
  EXPECT_EQ(context.event()->size(), 30000u);
  EXPECT_EQ(*context.event()->findString("k2"), "t");
  EXPECT_EQ(*context.event()->findString("k3"), "d");
}

TEST_F(ContextTest, DescriptionPrintsEventVariablesAndRulebase) {
  auto variables = std::make_shared<VariableStore>(
      VariableStore{{kGlobalsKey, Dictionary{{"g", Value::Integer(1)}}}});
  Context with(variables, std::make_shared<Rulebase>(), Dictionary{{"eventType", "a"}});
  EXPECT_EQ(with.description(), "event = " + plist::Describe(*with.event()) + " \n variables = " +
                                    plist::Describe(*variables) + " \n rulebase = {}");
  Context nothing(nullptr, nullptr);
  EXPECT_EQ(nothing.description(), "event = (null) \n variables = (null) \n rulebase = (null)");
}

TEST_F(ContextTest, StatisticsAreTakenAtFirstUseAndThenKept) {
  SetMeminfoPathForTesting(dir_ + "/missing");
  Context context(std::make_shared<VariableStore>(), std::make_shared<Rulebase>());
  WriteMeminfo(8);  // present by the time a rule first reads a "system:" value
  const StatContext* first = context.stats();
  ASSERT_NE(first, nullptr);
  const uint32_t freePages = first->counters[0];
  WriteMeminfo(8000);
  EXPECT_EQ(context.stats(), first);
  EXPECT_EQ(context.stats()->counters[0], freePages);
  EXPECT_EQ(context.variableValueForKey("builtin:system:memory:free", ""),
            Value(std::to_string(freePages * HostPageSize())));
}

TEST_F(ContextTest, AContextWithoutStatisticsServesEveryOtherVariable) {
  SetMeminfoPathForTesting(dir_ + "/missing");
  Context context(std::make_shared<VariableStore>(), std::make_shared<Rulebase>(),
                  Dictionary{{"eventType", "a"}});
  EXPECT_EQ(context.stats(), nullptr);
  context.setVariableValue(Value("1"), "global:g", "");
  for (const char* key : {"builtin:system:memory:free", "builtin:system:cpu:load"}) {
    EXPECT_EQ(context.variableValueForKey(key, ""), Value("rule-error")) << key;
  }
  EXPECT_EQ(context.variableValueForKey("builtin:hostName", ""), Value(HostName()));
  EXPECT_EQ(context.variableValueForKey("global:g", ""), Value::Integer(1));
  EXPECT_EQ(context.variableValueForKey("event:eventType", ""), Value("a"));
}

double Number(const std::optional<Value>& v) { return v ? v->numberValue() : -1; }

TEST_F(ContextTest, IntervalsAreHoursMinutesAndFractionalSecondsWithoutRangeLimits) {
  EXPECT_DOUBLE_EQ(ParseInterval("01:30:00", true), 5400);
  EXPECT_DOUBLE_EQ(ParseInterval("00:00:01.5", false), -1.5);
  EXPECT_DOUBLE_EQ(ParseInterval("0:90:75", true), 5475);
  EXPECT_DOUBLE_EQ(ParseInterval("-1:00:00", true), -3600);
  // Malformed intervals count as zero and are logged.
  EXPECT_EQ(ParseInterval("90", true), 0);
  EXPECT_EQ(ParseInterval("1:2:3:4", true), 0);
  EXPECT_EQ(Log(),
            "ParseInterval: interval string is malformed, expecting  HH:MM:SS.SSS got 90\n"
            "ParseInterval: interval string is malformed, expecting  HH:MM:SS.SSS got 1:2:3:4\n");
}

TEST_F(ContextTest, NowAndItsOffsetsAreSecondsSince2001) {
  Context context(std::make_shared<VariableStore>(), std::make_shared<Rulebase>());
  const auto now = context.valueForBuiltinVariableKey("now");
  ASSERT_TRUE(now && now->isString());
  // "%f": fixed point with six decimals.
  EXPECT_EQ(now->string().size() - now->string().find('.'), 7u);
  EXPECT_NEAR(Number(now), SecondsSince2001Now(), 60);
  EXPECT_NEAR(Number(context.valueForBuiltinVariableKey("now+01:30:00")) - Number(now), 5400, 60);
  EXPECT_NEAR(Number(context.valueForBuiltinVariableKey("nowX00:10:00")) - Number(now), -600, 60);
  EXPECT_NEAR(Number(context.valueForBuiltinVariableKey("nowhere")), Number(now), 60);
  EXPECT_NE(Log().find("got ere\n"), std::string::npos);
}

TEST_F(ContextTest, MemoryKeysAreMatchedByTheirEnding) {
  StatContext stats;
  stats.counters[0] = 1;  // free
  stats.counters[1] = 2;  // active
  stats.counters[2] = 4;  // inactive
  stats.counters[3] = 8;  // wired
  stats.count = 4;
  const uint64_t page = HostPageSize();
  const std::pair<const char*, std::string> cases[] = {
      {"system:memory:free", std::to_string(1 * page)},
      {"system:memory:active", std::to_string(2 * page)},
      {"system:memory:inactive", std::to_string(4 * page)},
      {"system:memory:wired", std::to_string(8 * page)},
      {"system:memory:used", std::to_string(14 * page)},
      {"system:memory:unused", std::to_string(14 * page)},
      {"system:memory:installed", "not-implemented"},
      {"system:memory:pageins", "not-implemented"},
      {"system:memory:pageouts", "not-implemented"},
      {"system:memory:other", "not-implemented"},
      {"system:cpu:load", "not-implemented"},
  };
  for (const auto& [key, expected] : cases)
    EXPECT_EQ(SystemStatForKey(key, stats), expected) << key;
}

TEST_F(ContextTest, SystemHostAndEventKeys) {
  WriteMeminfo(8);
  Context context(std::make_shared<VariableStore>(), std::make_shared<Rulebase>());
  EXPECT_EQ(context.valueForBuiltinVariableKey("system:memory:free"),
            Value(std::to_string(8 * 1024 / HostPageSize() * HostPageSize())));
  EXPECT_EQ(context.valueForBuiltinVariableKey("hostIP"),
            context.valueForBuiltinVariableKey("hostIPv6"));
  EXPECT_EQ(context.valueForBuiltinVariableKey("Now"), std::nullopt);  // names are case-sensitive

  const plist::Dictionary event{{"eventType", "a.b"},
                                {"eventDetails", plist::Dictionary{{"x", "1"}}}};
  Context withEvent(std::make_shared<VariableStore>(), std::make_shared<Rulebase>(), event);
  const auto dictionary = withEvent.valueForBuiltinVariableKey("eventDictionary");
  ASSERT_TRUE(dictionary && dictionary->isDictionary());
  EXPECT_EQ(*dictionary->dictionary().findString("x"), "1");
}

}  // namespace
}  // namespace tarvod
