#include "platform/structured_log.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <string>
#include <thread>

#include "platform/testing/json_lines.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

TEST(JournalFieldName, MapsAttributeNamesToStableFieldNames) {
  const std::pair<const char*, const char*> cases[] = {
      {"clientIP", "CLIENTIP"},
      {"eventType", "EVENTTYPE"},
      {"TimeNanoSec", "TIMENANOSEC"},
      {"client-ip.v4", "CLIENT_IP_V4"},
      {"message", "AMESSAGE"},  // would replace the record's own text
      {"Priority", "APRIORITY"},
      {"syslog_identifier", "ASYSLOG_IDENTIFIER"},
      {"_PID", "A_PID"},  // the journal's trusted fields begin with "_"
      {"1st-try", "A1ST_TRY"},
      {"", "A"},
      {"\xc3\xa9t\xc3\xa9", "A__T__"},
      {"MESSAGES", "MESSAGES"},
  };
  for (const auto& [attribute, field] : cases) {
    EXPECT_EQ(JournalFieldName(attribute), field) << attribute;
  }
  EXPECT_EQ(JournalFieldName(std::string(100, 'x')), std::string(64, 'X'));
}

class JsonLinesSink : public ::testing::Test {
 protected:
  void SetUp() override {
    path_ = capture_.directory() + "/records.jsonl";
    ConfigureStructuredLog(path_);
  }
  void TearDown() override { ConfigureStructuredLog(""); }
  testing::LogCapture capture_;
  std::string path_;
};

TEST_F(JsonLinesSink, WritesEachRecordAsOneJsonObjectWithTheAttributesUnderTheirNames) {
  const LogAttributes attributes = {
      {"eventType", "auth.failure"},
      {"message", "quote \" backslash \\ newline \n tab \t bell \x07 end"},
      {"client-ip", "10.0.0.1"},
      {"caf\xc3\xa9", "%s%n%d"},
  };
  ASSERT_TRUE(DefaultStructuredLog().send(4, "text with \"%s%n\"\nand a second line", attributes));
  ASSERT_TRUE(DefaultStructuredLog().send(1, "", {}));

  const auto records = testing::ReadJsonRecords(path_);
  ASSERT_EQ(records.size(), 2u);
  ASSERT_TRUE(records[0].parsed);
  EXPECT_EQ(records[0].identifier, "tarvod");
  EXPECT_EQ(records[0].priority, 4);
  EXPECT_EQ(records[0].message, "text with \"%s%n\"\nand a second line");
  EXPECT_EQ(records[0].attributes, attributes);
  ASSERT_TRUE(records[1].parsed);
  EXPECT_EQ(records[1].priority, 1);
  EXPECT_TRUE(records[1].attributes.empty());

  // An independent JSON reader agrees that every line is one valid object.
  const std::string command =
      "python3 -c 'import json,sys\n"
      "for l in open(sys.argv[1], encoding=\"utf-8\"):\n"
      " r = json.loads(l); print(sorted(r), sorted(r[\"attributes\"]))' " +
      path_;
  FILE* pipe = popen(command.c_str(), "r");
  ASSERT_NE(pipe, nullptr);
  std::string out;
  char buffer[512];
  while (size_t n = fread(buffer, 1, sizeof buffer, pipe)) out.append(buffer, n);
  ASSERT_EQ(pclose(pipe), 0) << out;
  EXPECT_EQ(out,
            "['attributes', 'identifier', 'message', 'priority'] ['caf\xc3\xa9', 'client-ip', "
            "'eventType', 'message']\n"
            "['attributes', 'identifier', 'message', 'priority'] []\n");
}

TEST_F(JsonLinesSink, AppendsToAFileOrCreatesItWithMode0644AndReportsOneItCannotOpen) {
  {
    FILE* f = fopen(path_.c_str(), "w");
    ASSERT_NE(f, nullptr);
    fputs("{\"earlier\": 1}\n", f);
    fclose(f);
  }
  ASSERT_TRUE(DefaultStructuredLog().send(5, "m", {}));
  const auto records = testing::ReadJsonRecords(path_);
  ASSERT_EQ(records.size(), 2u);
  EXPECT_TRUE(records[1].parsed);

  const std::string fresh = capture_.directory() + "/fresh.jsonl";
  ConfigureStructuredLog(fresh);
  const mode_t mask = umask(0);
  ASSERT_TRUE(DefaultStructuredLog().send(5, "m", {}));
  umask(mask);
  struct stat st {};
  ASSERT_EQ(stat(fresh.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);

  ConfigureStructuredLog(capture_.directory() + "/missing/records.jsonl");
  EXPECT_FALSE(DefaultStructuredLog().send(5, "m", {}));
  // A FIFO nobody reads fails at once instead of waiting for a reader.
  const std::string fifo = capture_.directory() + "/fifo";
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  ConfigureStructuredLog(fifo);
  EXPECT_FALSE(DefaultStructuredLog().send(5, "m", {}));
}

TEST_F(JsonLinesSink, KeepsLinesWholeWhenTwoThreadsSendAtOnce) {
  constexpr int kPerThread = 200;
  const auto sender = [](const std::string& tag) {
    const LogAttributes attributes = {{"tag", tag}, {"padding", std::string(3000, 'p')}};
    for (int i = 0; i < kPerThread; ++i) DefaultStructuredLog().send(5, tag, attributes);
  };
  std::thread a(sender, "a");
  std::thread b(sender, "b");
  a.join();
  b.join();
  const auto records = testing::ReadJsonRecords(path_);
  ASSERT_EQ(records.size(), 2u * kPerThread);
  for (const auto& record : records) {
    ASSERT_TRUE(record.parsed);
    EXPECT_EQ(record.attribute("tag"), record.message);
  }
}

// The file stays open between records; a rotation by renaming or removing it is followed at
// the next record (or batch), one by truncation at once.
TEST_F(JsonLinesSink, FollowsThePathWhenTheFileIsRotated) {
  ASSERT_TRUE(DefaultStructuredLog().send(5, "one", {}));
  ASSERT_EQ(rename(path_.c_str(), (path_ + ".1").c_str()), 0);
  ASSERT_TRUE(DefaultStructuredLog().send(5, "two", {}));
  ASSERT_EQ(unlink(path_.c_str()), 0);
  ASSERT_TRUE(DefaultStructuredLog().send(5, "three", {}));
  ASSERT_EQ(truncate(path_.c_str(), 0), 0);
  ASSERT_TRUE(DefaultStructuredLog().send(5, "four", {}));
  const auto old = testing::ReadJsonRecords(path_ + ".1");
  const auto now = testing::ReadJsonRecords(path_);
  ASSERT_EQ(old.size(), 1u);
  EXPECT_EQ(old[0].message, "one");
  ASSERT_EQ(now.size(), 1u);
  EXPECT_EQ(now[0].message, "four");
  EXPECT_EQ(testing::ReadWholeFile(path_).find('\0'), std::string::npos);
}

// A holding thread's records wait for the flush (or the size limit); another thread's record
// is written at once, after them, in order.
TEST_F(JsonLinesSink, HoldsTheRecordsOfAHoldingThreadUntilFlushed) {
  std::thread([&] {
    HoldStructuredLogRecordsOnThisThread();
    ASSERT_TRUE(DefaultStructuredLog().send(5, "held 1", {}));
    ASSERT_TRUE(DefaultStructuredLog().send(5, "held 2", {}));
    EXPECT_EQ(testing::ReadJsonRecords(path_).size(), 0u);
    FlushStructuredLog();
    EXPECT_EQ(testing::ReadJsonRecords(path_).size(), 2u);
    ASSERT_TRUE(DefaultStructuredLog().send(5, "held 3", {}));
  }).join();
  ASSERT_TRUE(DefaultStructuredLog().send(5, "direct", {}));
  std::thread([&] {
    HoldStructuredLogRecordsOnThisThread();
    const LogAttributes big = {{"padding", std::string(kMaxHeldRecordBytes, 'p')}};
    ASSERT_TRUE(DefaultStructuredLog().send(5, "large", big));
  }).join();
  const auto records = testing::ReadJsonRecords(path_);
  ASSERT_EQ(records.size(), 5u);
  EXPECT_EQ(records[2].message, "held 3");
  EXPECT_EQ(records[3].message, "direct");
  EXPECT_EQ(records[4].message, "large");
}

}  // namespace
}  // namespace tarvod
