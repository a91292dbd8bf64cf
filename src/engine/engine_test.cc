// Were two rules ever to run at once, updates of the shared global would be lost (and
// ThreadSanitizer, which runs this test, would report the race).
#include "engine/engine.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <thread>

#include "context/keychain.h"
#include "platform/structured_log.h"
#include "platform/testing/fake_clock.h"
#include "platform/testing/json_lines.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Array;
using plist::Dictionary;
using plist::Value;

RulePtr CountingRule(const char* name, Dictionary extra = {}) {
  Dictionary rule{
      {"name", name},
      {"filePath", "/rules/count.plist"},
      {"criterion", Array{Value(Dictionary{{"operator", "true"}})}},
      {"variables", Dictionary{{"global:count", "${global:count} + 1"}}},
  };
  for (auto& [key, value] : extra) rule.set(key, value);
  return std::make_shared<const Rule>(std::move(rule));
}

int64_t Count(Engine& engine) {
  int64_t count = -1;
  EXPECT_TRUE(engine.withVariables([&](VariableStore& store) {
    count = store.findDictionary(kGlobalsKey)->find("count")->integerValue();
  }));
  return count;
}

// A rulebase with the given rules for each event type.
std::shared_ptr<Rulebase> Rules(std::initializer_list<std::pair<const char*, RulePtr>> rules) {
  auto rulebase = std::make_shared<Rulebase>();
  for (const auto& [type, rule] : rules) (*rulebase)[type].rules.push_back(rule);
  return rulebase;
}

class EngineTest : public ::testing::Test {
 protected:
  void SetUp() override { ConfigureStructuredLog(records_); }
  void TearDown() override { ConfigureStructuredLog(""); }

  testing::LogCapture capture_{0};
  const std::string records_ = capture_.directory() + "/records.jsonl";
  FakeClock clock_{1000};
  Engine engine_{clock_, Dictionary{{"count", Value::Integer(0)}}};
};

TEST_F(EngineTest, EventsFromTwoThreadsNeverRunRulesAtTheSameTime) {
  const auto rulebase = Rules({{"tick", CountingRule("first")},
                               {"tick", CountingRule("second")},
                               {"tick.fast", CountingRule("third")}});
  engine_.swapRulebase(rulebase);

  constexpr int kEventsPerThread = 150;
  const auto sender = [&](const char* type) {
    for (int i = 0; i < kEventsPerThread; ++i) engine_.dispatchEvent({{"eventType", type}});
  };
  std::thread timer(sender, "tick");
  std::thread input(sender, "tick.fast");
  timer.join();
  input.join();

  // tick runs two rules; tick.fast runs its own and then tick's two.
  EXPECT_EQ(Count(engine_), kEventsPerThread * 2 + kEventsPerThread * 3);
  EXPECT_EQ(rulebase->at("tick").eventCounter.load(), 2u * kEventsPerThread);
  EXPECT_EQ(rulebase->at("tick.fast").eventCounter.load(), 1u * kEventsPerThread);
  EXPECT_EQ(rulebase->at("tick").lastEventTimestamp.load(), 1000.0);
  // One record per tick event and two per tick.fast event, none blocked.
  const auto written = testing::ReadJsonRecords(records_);
  EXPECT_EQ(written.size(), 3u * kEventsPerThread);
  for (const auto& record : written) EXPECT_EQ(record.attribute("eventBlocked"), "false");
  EXPECT_EQ(capture_.text(), "");
}

TEST_F(EngineTest, EveryEventSeesAWholeRulebaseWhileRulebasesAreSwapped) {
  const auto makeRulebase = [] { return Rules({{"tick", CountingRule("count")}}); };
  engine_.swapRulebase(makeRulebase());
  constexpr int kEvents = 3000;
  std::thread sender([&] {
    for (int i = 0; i < kEvents; ++i) engine_.dispatchEvent({{"eventType", "tick"}});
  });
  for (int i = 0; i < 200; ++i) engine_.swapRulebase(makeRulebase());
  sender.join();
  EXPECT_EQ(Count(engine_), kEvents);
}

TEST_F(EngineTest, EventsAfterCloseDispatchReachNoRule) {
  engine_.swapRulebase(Rules({{"tick", CountingRule("count")}}));
  engine_.dispatchEvent({{"eventType", "tick"}});
  engine_.closeDispatch();
  engine_.dispatchEvent({{"eventType", "tick"}});
  EXPECT_EQ(engine_.drain(10), 0u);
  EXPECT_EQ(Count(engine_), 1);
  EXPECT_EQ(testing::ReadJsonRecords(records_).size(), 1u);
}

// A reload reads the store again even when its inode and time are unchanged.
TEST_F(EngineTest, ContextsReadTheEnginesKeychainAndLoadingRulesRereadsIt) {
  const std::string store = capture_.directory() + "/system.keychain";
  auto writeStore = [&](const char* password) {
    std::ofstream(store, std::ios::trunc)
        << "<plist><array><dict><key>service</key><string>mail</string><key>account</key>"
           "<string>relay</string><key>password</key><string>"
        << password << "</string></dict></array></plist>";
    chmod(store.c_str(), 0600);
    const timespec times[2] = {{1, 0}, {1, 0}};
    utimensat(AT_FDCWD, store.c_str(), times, 0);
  };
  writeStore("first");
  engine_.setKeychain(std::make_shared<Keychain>(store));
  const RulePtr copy =
      CountingRule("copy", {{"variables", Dictionary{{"global:pw", "${keychain:relay@mail}"}}}});
  engine_.swapRulebase(Rules({{"tick", copy}}));
  auto password = [&] {
    engine_.dispatchEvent({{"eventType", "tick"}});
    std::string found;
    engine_.withVariables([&](VariableStore& variables) {
      found = variables.findDictionary(kGlobalsKey)->find("pw")->string();
    });
    return found;
  };
  EXPECT_EQ(password(), "first");
  writeStore("second");
  EXPECT_EQ(password(), "first");
  size_t count = 0;
  engine_.loadRules(capture_.directory() + "/none.plist", &count);
  EXPECT_EQ(password(), "second");
}

TEST_F(EngineTest, ADrainThatTimesOutDropsTheRestAndStillReachesTheStore) {
  engine_.swapRulebase(Rules({{"tick", CountingRule("count")}}));
  engine_.dispatchEvent({{"eventType", "tick"}});
  // An action stuck in a blocking call, as a write to a file nobody drains would be.
  std::atomic<bool> release{false};
  engine_.queue().async([&] {
    SerialQueue::BlockingSection blocking;
    while (!release.load()) usleep(1000);
  });
  for (int i = 0; i < 5; ++i) engine_.dispatchEvent({{"eventType", "tick"}});

  EXPECT_EQ(engine_.drain(0.2), 6u);  // the stuck job and the five events' jobs
  EXPECT_EQ(Count(engine_), 1);

  // The stuck job finishes; the dropped jobs never run.
  release = true;
  usleep(50'000);
  EXPECT_EQ(Count(engine_), 1);
  EXPECT_EQ(engine_.queue().pending(), 0u);
}

TEST_F(EngineTest, EmptyComponentsOfATypeArePrefixesAndATypelessEventLeavesNoTrace) {
  SetDebugLevel(2);
  engine_.swapRulebase(Rules({{"a.", CountingRule("a dot")}, {"", CountingRule("empty type")}}));
  engine_.dispatchEvent({{"eventDetails", Dictionary{{"a", "b"}}}});
  engine_.dispatchEvent({{"eventType", "a..b"}});
  EXPECT_EQ(Count(engine_), 1);
  const std::string log = capture_.text();
  EXPECT_TRUE(testing::LinesInOrder(
      log, {"  Dropping event a..b because it has no associated rules\n",
            "  Processing event: a.\n", "  Dropping event a because it has no associated rules\n"}))
      << log;
  EXPECT_EQ(testing::ReadJsonRecords(records_).size(), 2u);
}

TEST_F(EngineTest, PrefixesRunLongestFirstAndEachWritesItsRecord) {
  // More prefixes with rules than an event's job keeps in place, and a full type without.
  const char* const types[] = {"a", "a.b", "a.b.c", "a.b.c.d", "a.b.c.d.e"};
  auto rulebase = std::make_shared<Rulebase>();
  for (const char* type : types) {
    (*rulebase)[type].rules.push_back(CountingRule(
        type,
        {{"variables", Dictionary{{"global:order", std::string("${global:order} ") + type}}}}));
  }
  engine_.swapRulebase(rulebase);
  engine_.dispatchEvent({{"eventType", "a.b.c.d.e.f"}});
  std::string order;
  engine_.withVariables([&](VariableStore& store) {
    order = store.findDictionary(kGlobalsKey)->find("order")->textForm();
  });
  EXPECT_EQ(order, "0 a.b.c.d.e a.b.c.d a.b.c a.b a");
  const auto written = testing::ReadJsonRecords(records_);
  ASSERT_EQ(written.size(), 6u);
  EXPECT_EQ(written[0].attribute("hasRules"), "false");
  for (size_t i = 1; i < written.size(); ++i) {
    EXPECT_EQ(written[i].message, "a.b.c.d.e.f hasRules=true eventBlocked=false");
  }
  EXPECT_EQ(rulebase->at("a").eventCounter.load(), 1u);
}

TEST_F(EngineTest, TypesBeyondTheLimitsAreDroppedWithOneMessage) {
  SetDebugLevel(1);
  engine_.swapRulebase(Rules({{"a", CountingRule("a")}}));
  auto repeated = [](const std::string& piece, size_t times) {
    std::string text;
    for (size_t i = 0; i < times; ++i) text += piece;
    return text;
  };
  const struct {
    std::string type;
    bool runs;
  } cases[] = {
      {"a" + repeated(".b", 63), true},           // 64 components
      {"a" + repeated(".b", 64), false},          // 65
      {"a." + std::string(1022, 'b'), true},      // 1,024 bytes
      {"a." + std::string(1023, 'b'), false},     // 1,025
      {"a" + repeated(".a", 60'000 - 1), false},  // 120 KB of "a."
  };
  int64_t expected = 0;
  for (const auto& c : cases) {
    engine_.dispatchEvent({{"eventType", c.type}});
    expected += c.runs ? 1 : 0;
  }
  EXPECT_EQ(Count(engine_), expected);
  // Two records for each event that ran (its full type and "a"), none for a dropped one.
  EXPECT_EQ(testing::ReadJsonRecords(records_).size(), 2u * static_cast<size_t>(expected));
  const std::string log = capture_.text();
  size_t dropped = 0;
  for (size_t at = log.find("DispatchEvent: dropping"); at != std::string::npos;
       at = log.find("DispatchEvent: dropping", at + 1)) {
    ++dropped;
  }
  EXPECT_EQ(dropped, 3u) << log;
  EXPECT_NE(log.find("has 119999 bytes and 60000 components (at most 1024 and 64)"),
            std::string::npos);
}

}  // namespace
}  // namespace tarvod
