// Events dispatched from two threads at once: their rules take turns on the processing queue.
// Every rule run reads and rewrites the same global; were two rules ever to run at the same
// time, updates would be lost and ThreadSanitizer (this test is THREADED) would report the
// unsynchronised access to the variable store.

#include <gtest/gtest.h>

#include <thread>

#include "engine/dispatch.h"
#include "engine/keyword_tables.h"
#include "platform/structured_log.h"
#include "platform/testing/json_lines.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Array;
using plist::Dictionary;
using plist::Value;

RulePtr CountingRule(const char* name) {
  return std::make_shared<const Rule>(Dictionary{
      {"name", name},
      {"filePath", "/rules/count.plist"},
      {"criterion", Array{Value(Dictionary{{"operator", "true"}})}},
      {"variables", Dictionary{{"global:count", "${global:count} + 1"}}},
  });
}

TEST(DispatchConcurrency, EventsFromTwoThreadsNeverRunRulesAtTheSameTime) {
  testing::LogCapture capture(0);
  const std::string records = capture.directory() + "/records.jsonl";
  ConfigureStructuredLog(records);
  BuildKeywordTables();

  auto variables = std::make_shared<VariableStore>();
  variables->set(kGlobalsKey, Dictionary{{"count", Value::Integer(0)}});
  auto rulebase = std::make_shared<Rulebase>();
  (*rulebase)["tick"].rules = {CountingRule("first"), CountingRule("second")};
  (*rulebase)["tick.fast"].rules = {CountingRule("third")};

  constexpr int kEventsPerThread = 150;
  const auto sender = [&](const char* type) {
    for (int i = 0; i < kEventsPerThread; ++i) {
      DispatchEvent(rulebase, Dictionary{{"eventType", type}}, variables);
    }
  };
  std::thread timer(sender, "tick");
  std::thread input(sender, "tick.fast");
  timer.join();
  input.join();
  ProcessingQueue().drain();

  // tick runs two rules; tick.fast runs its own and then tick's two.
  const int64_t expected = kEventsPerThread * 2 + kEventsPerThread * 3;
  EXPECT_EQ(variables->findDictionary(kGlobalsKey)->find("count")->integerValue(), expected);
  EXPECT_EQ((*rulebase)["tick"].eventCounter.load(), 2u * kEventsPerThread);
  EXPECT_EQ((*rulebase)["tick.fast"].eventCounter.load(), 1u * kEventsPerThread);
  // One record per tick event and two per tick.fast event, none blocked.
  const auto written = testing::ReadJsonRecords(records);
  EXPECT_EQ(written.size(), 3u * kEventsPerThread);
  for (const auto& record : written) EXPECT_EQ(record.attribute("eventBlocked"), "false");
  EXPECT_EQ(capture.text(), "");
  ConfigureStructuredLog("");
}

TEST(Dispatch, AnEventWithoutTypeLeavesNoTrace) {
  testing::LogCapture capture(6);
  const std::string records = capture.directory() + "/records.jsonl";
  ConfigureStructuredLog(records);
  auto rulebase = std::make_shared<Rulebase>();
  (*rulebase)[""].rules = {CountingRule("empty type")};
  DispatchEvent(rulebase, Dictionary{{"eventDetails", Dictionary{{"a", "b"}}}},
                std::make_shared<VariableStore>());
  ProcessingQueue().drain();
  EXPECT_EQ(capture.text(), "");
  EXPECT_TRUE(testing::ReadJsonRecords(records).empty());
  ConfigureStructuredLog("");
}

TEST(Dispatch, EmptyComponentsOfATypeArePrefixesToo) {
  testing::LogCapture capture(2);
  const std::string records = capture.directory() + "/records.jsonl";
  ConfigureStructuredLog(records);
  auto variables = std::make_shared<VariableStore>();
  variables->set(kGlobalsKey, Dictionary{{"count", Value::Integer(0)}});
  auto rulebase = std::make_shared<Rulebase>();
  (*rulebase)["a."].rules = {CountingRule("a dot")};
  DispatchEvent(rulebase, Dictionary{{"eventType", "a..b"}}, variables);
  ProcessingQueue().drain();
  EXPECT_EQ(variables->findDictionary(kGlobalsKey)->find("count")->integerValue(), 1);
  const std::string log = capture.text();
  EXPECT_TRUE(testing::LinesInOrder(
      log, {"  Dropping event a..b because it has no associated rules\n",
            "  Processing event: a.\n", "  Dropping event a because it has no associated rules\n"}))
      << log;
  EXPECT_EQ(testing::ReadJsonRecords(records).size(), 2u);
  ConfigureStructuredLog("");
}

TEST(Dispatch, TypesBeyondTheLimitsAreDroppedWithOneMessage) {
  testing::LogCapture capture(1);
  const std::string records = capture.directory() + "/records.jsonl";
  ConfigureStructuredLog(records);
  auto variables = std::make_shared<VariableStore>();
  variables->set(kGlobalsKey, Dictionary{{"count", Value::Integer(0)}});
  auto rulebase = std::make_shared<Rulebase>();
  (*rulebase)["a"].rules = {CountingRule("a")};
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
    DispatchEvent(rulebase, Dictionary{{"eventType", c.type}}, variables);
    expected += c.runs ? 1 : 0;
  }
  ProcessingQueue().drain();
  EXPECT_EQ(variables->findDictionary(kGlobalsKey)->find("count")->integerValue(), expected);
  // Two records for each event that ran (its full type and "a"), none for a dropped one.
  EXPECT_EQ(testing::ReadJsonRecords(records).size(), 2u * static_cast<size_t>(expected));
  const std::string log = capture.text();
  size_t dropped = 0;
  for (size_t at = log.find("DispatchEvent: dropping"); at != std::string::npos;
       at = log.find("DispatchEvent: dropping", at + 1)) {
    ++dropped;
  }
  EXPECT_EQ(dropped, 3u) << log;
  EXPECT_NE(log.find("has 119999 bytes and 60000 components (at most 1024 and 64)"),
            std::string::npos);
  ConfigureStructuredLog("");
}

}  // namespace
}  // namespace tarvod
