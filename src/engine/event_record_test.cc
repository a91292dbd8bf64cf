#include "engine/event_record.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cmath>
#include <string>

#include "platform/structured_log.h"
#include "platform/testing/json_lines.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Dictionary;
using plist::Value;

class EventRecordTest : public ::testing::Test {
 protected:
  void SetUp() override {
    path_ = capture_.directory() + "/records.jsonl";
    ConfigureStructuredLog(path_);
  }
  void TearDown() override { ConfigureStructuredLog(""); }
  std::vector<testing::JsonRecord> Records() const { return testing::ReadJsonRecords(path_); }
  testing::JsonRecord Only(const Dictionary& event, bool hasRules, bool blocked) {
    WriteEventRecord(event, hasRules, blocked);
    auto records = Records();
    EXPECT_EQ(records.size(), 1u);
    return records.empty() ? testing::JsonRecord{} : records[0];
  }
  testing::LogCapture capture_{4};
  std::string path_;
};

struct TimeCase {
  std::optional<Value> timestamp;
  std::optional<std::string> time;
  std::optional<std::string> nanoseconds;
};

TEST_F(EventRecordTest, SplitsTheTimestampIntoUnixSecondsAndNanoseconds) {
  const TimeCase cases[] = {
      {Value::Real(0), "978307200", "0"},
      {Value::Real(1.5), "978307201", "500000000"},
      {Value::Integer(10), "978307210", "0"},
      {Value::FromDate({2.25}), "978307202", "250000000"},
      {std::nullopt, std::nullopt, std::nullopt},
      // Before 1970 or not a number: clamped rather than converted with an undefined result.
      {Value::Real(-1e12), "0", "0"},
      {Value::Real(std::nan("")), "0", "0"},
  };
  for (const TimeCase& c : cases) {
    unlink(path_.c_str());
    Dictionary event{{"eventType", "t"}};
    if (c.timestamp) event.set("eventTimestamp", *c.timestamp);
    const auto record = Only(event, false, false);
    EXPECT_EQ(record.attribute("Time"), c.time) << Describe(event);
    EXPECT_EQ(record.attribute("TimeNanoSec"), c.nanoseconds) << Describe(event);
    EXPECT_FALSE(record.attribute("eventTimestamp"));
  }
}

TEST_F(EventRecordTest, FlattensDetailsBesideTopLevelKeysAndSetsTheFixedAttributesLast) {
  const Dictionary event{
      {"eventType", "auth.failure"},
      {"eventSource", "Auditpipe"},
      {"eventDetails", Dictionary{{"clientIP", "10.1.2.3"}, {"eventSource", "details win"}}},
      {"count", Value::Integer(3)},
      {"hasRules", "overwritten"},
  };
  // The records of one event's prefixes share one gathering; each has its own flags.
  EventRecord records(event);
  records.write(false, false);
  records.write(true, true);
  const auto written = Records();
  ASSERT_EQ(written.size(), 2u);
  std::vector<std::pair<std::string, std::string>> expected = {
      {"eventType", "auth.failure"},
      {"eventSource", "details win"},
      {"clientIP", "10.1.2.3"},
      {"count", "3"},
      {"hasRules", "false"},
      {"eventBlocked", "false"},
      {"Level", "Alert"},
  };
  EXPECT_EQ(written[0].priority, 1);
  EXPECT_EQ(written[0].message, "auth.failure hasRules=false eventBlocked=false");
  EXPECT_EQ(written[0].attributes, expected);
  expected[4].second = expected[5].second = "true";
  EXPECT_EQ(written[1].message, "auth.failure hasRules=true eventBlocked=true");
  EXPECT_EQ(written[1].attributes, expected);
  EXPECT_NE(capture_.text().find("Logging event auth.failure to KVLOG tarvod database\n"),
            std::string::npos);
}

TEST_F(EventRecordTest, RefusesAnEventWithMoreAttributesThanARecordHolds) {
  Dictionary details;
  for (int i = 0; i < 1200; ++i) details.set("k" + std::to_string(i), Value("v"));
  const Dictionary event{{"eventType", "big"}, {"eventDetails", details}};
  EventRecord records(event);
  records.write(false, false);
  records.write(true, false);
  EXPECT_TRUE(Records().empty());
  const std::string refusal = "Failed to configure KVLOG message with key k999\n";
  const std::string log = capture_.text();
  ASSERT_NE(log.find(refusal), std::string::npos);
  EXPECT_NE(log.find(refusal, log.find(refusal) + 1), std::string::npos);  // once per record
}

TEST(EventRecordJournal, AnUnreachableJournalCostsOnlyTheRecord) {
  if (access("/run/systemd/journal/socket", F_OK) == 0) GTEST_SKIP() << "journald is running";
  testing::LogCapture capture(0);
  ConfigureStructuredLog("");
  WriteEventRecord(Dictionary{{"eventType", "auth.failure"}}, true, false);
  WriteEventRecord(Dictionary{{"eventType", "second"}}, false, false);
  EXPECT_EQ(capture.text(),
            "Failed to log event auth.failure to KVLOG tarvod database\n"
            "Failed to log event second to KVLOG tarvod database\n");
}

}  // namespace
}  // namespace tarvod
