#include "context/builtins.h"

#include <gtest/gtest.h>

#include <fstream>

#include "context/context.h"
#include "platform/diagnostic_log.h"
#include "platform/host_stats.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Value;

class BuiltinsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    SetDebugLevel(0);
    const std::string meminfo = capture_.directory() + "/meminfo";
    std::ofstream(meminfo) << "MemFree: 8 kB\nActive: 16 kB\nInactive: 32 kB\nUnevictable: 64 kB\n";
    SetMeminfoPathForTesting(meminfo);
  }
  void TearDown() override { SetMeminfoPathForTesting(""); }
  std::string Log() const { return capture_.text(); }
  Context MakeContext() {
    return Context(std::make_shared<VariableStore>(), std::make_shared<Rulebase>());
  }
  testing::LogCapture capture_;
};

double Number(const std::optional<Value>& v) { return v ? v->numberValue() : -1; }

TEST_F(BuiltinsTest, IntervalsAreHoursMinutesAndFractionalSecondsWithoutRangeLimits) {
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

TEST_F(BuiltinsTest, NowAndItsOffsetsAreSecondsSince2001) {
  Context context = MakeContext();
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

TEST_F(BuiltinsTest, MemoryKeysAreMatchedByTheirEnding) {
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

TEST_F(BuiltinsTest, SystemHostAndEventKeys) {
  Context context = MakeContext();
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
