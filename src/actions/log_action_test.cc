#include "actions/log_action.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <sstream>
#include <string>

#include "platform/structured_log.h"
#include "platform/testing/json_lines.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

void WriteAll(const std::string& path, const std::string& text) {
  std::ofstream(path, std::ios::binary) << text;
}

using plist::Dictionary;
using plist::Value;

constexpr const char* kRulesFile = "/rules/log.plist";

class LogActionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    BuildLevelNameTable();
    dir_ = capture_.directory();
    records_ = dir_ + "/records.jsonl";
    ConfigureStructuredLog(records_);
    auto store = std::make_shared<VariableStore>();
    store->set(kGlobalsKey, Dictionary{{"who", Value("root")}, {"file", Value(dir_ + "/v.log")}});
    context_ = std::make_unique<Context>(store, std::make_shared<Rulebase>(),
                                         Dictionary{{"eventType", "t"}});
  }
  void TearDown() override { ConfigureStructuredLog(""); }
  void Run(Dictionary action) {
    action.set("type", Value("log"));
    const Dictionary rule{{"filePath", kRulesFile}};
    LogAction().perform(action, FiredRule{rule, "log", kRulesFile}, *context_);
  }
  std::vector<testing::JsonRecord> Records() const { return testing::ReadJsonRecords(records_); }

  testing::LogCapture capture_{3};
  std::string dir_;
  std::string records_;
  std::unique_ptr<Context> context_;
};

// Kept open or not, the same bytes: the message and one newline, appended.
TEST_F(LogActionTest, AppendsTheMessageByteForByteOrCreatesTheFileWithMode0644) {
  for (const bool keep : {false, true}) {
    SCOPED_TRACE(keep);
    SetKeepLogFilesOpen(keep);
    const std::string path = dir_ + (keep ? "/kept.log" : "/out.log");
    WriteAll(path, "existing\n");
    Run(Dictionary{{"message", "nine char"}, {"logPath", path}});
    Run(Dictionary{{"message", "two\nlines ${global:who} 100%s%n \\:"}, {"logPath", path}});
    EXPECT_EQ(testing::ReadWholeFile(path), "existing\nnine char\ntwo\nlines root 100%s%n :\n");
  }
  SetKeepLogFilesOpen(false);
  const mode_t mask = umask(0);
  Run(Dictionary{{"message", "m"}, {"logPath", "${global:file}"}});
  umask(mask);
  struct stat st {};
  ASSERT_EQ(stat((dir_ + "/v.log").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  EXPECT_EQ(testing::ReadWholeFile(dir_ + "/v.log"), "m\n");
}

TEST_F(LogActionTest, DoesNothingForAnAbsentOrEmptyMessage) {
  Run(Dictionary{{"logPath", dir_ + "/none.log"}});
  Run(Dictionary{{"message", ""}, {"logPath", dir_ + "/none.log"}});
  Run(Dictionary{{"message", "${global:nothing}"}, {"logPath", dir_ + "/none.log"}});
  EXPECT_EQ(capture_.text(), "");
  EXPECT_NE(access((dir_ + "/none.log").c_str(), F_OK), 0);
}

TEST_F(LogActionTest, ReportsAFileThatCannotBeOpened) {
  const std::string fifo = dir_ + "/fifo";
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  for (const bool keep : {false, true}) {
    SetKeepLogFilesOpen(keep);
    Run(Dictionary{{"message", "m"}, {"logPath", dir_ + "/missing/out.log"}});
    EXPECT_NE(capture_.text().find("LOG: Cannot open " + dir_ + "/missing/out.log errno = 2\n"),
              std::string::npos);
    // A FIFO is no log file: opened read-write, the daemon would be its own reader.
    Run(Dictionary{{"message", "m"}, {"logPath", fifo}});
    EXPECT_NE(capture_.text().find("LOG: Cannot open " + fifo + " errno = 6\n"), std::string::npos)
        << capture_.text();
  }
  SetKeepLogFilesOpen(false);
}

// A kept file follows a rotation by renaming at the next batch or after a reload, and one by
// copying and truncating at once.
TEST_F(LogActionTest, KeptFilesFollowTheirPath) {
  SetKeepLogFilesOpen(true);
  const std::string path = dir_ + "/kept.log";
  const auto line = [&](const std::string& message) {
    Run(Dictionary{{"message", message}, {"logPath", path}});
  };
  line("first");
  ASSERT_EQ(rename(path.c_str(), (path + ".1").c_str()), 0);
  line("same batch");  // the path is looked up once per batch
  EndLogBatch();
  line("next batch");
  EXPECT_EQ(testing::ReadWholeFile(path + ".1"), "first\nsame batch\n");
  EXPECT_EQ(testing::ReadWholeFile(path), "next batch\n");

  ASSERT_EQ(rename(path.c_str(), (path + ".2").c_str()), 0);
  ReopenKeptLogFiles();
  line("after reload");
  EXPECT_EQ(testing::ReadWholeFile(path), "after reload\n");

  ASSERT_EQ(truncate(path.c_str(), 0), 0);
  line("after truncation");
  EXPECT_EQ(testing::ReadWholeFile(path), "after truncation\n");
  EXPECT_EQ(capture_.text().find("Cannot"), std::string::npos) << capture_.text();
  SetKeepLogFilesOpen(false);
}

TEST_F(LogActionTest, SelectsTheStructuredLogByLogTypeInAnyCase) {
  const std::pair<const char*, bool> cases[] = {
      {"syslog", true}, {"SysLog", true}, {"KVLOG", true}, {"file", false}, {"", false}};
  for (const auto& [type, structured] : cases) {
    const size_t before = Records().size();
    Run(Dictionary{{"message", "m"}, {"logType", type}, {"logPath", dir_ + "/f.log"}});
    EXPECT_EQ(Records().size(), before + (structured ? 1 : 0)) << type;
  }
  EXPECT_EQ(testing::ReadWholeFile(dir_ + "/f.log"), "m\nm\n");
}

struct LevelCase {
  std::optional<Value> level;
  int64_t priority;
  bool complains;
};

TEST_F(LogActionTest, MapsLevelNamesToSeveritiesAndComplainsAboutAnythingElse) {
  const LevelCase cases[] = {
      {Value("warning"), 4, false}, {Value("WARNING"), 4, false}, {Value("emergency"), 0, false},
      {Value("debug"), 7, false},   {Value::Integer(4), 5, true}, {std::nullopt, 5, true},
      {Value("warnig"), 5, true},  // a misspelt name is no emergency
  };
  const std::string complaint =
      "The value for logLevel is not a valid level string. Using notice level. Valid strings "
      "are:\nemergency, alert, critical, error, warning, notice, info, debug\n";
  for (const LevelCase& c : cases) {
    unlink(records_.c_str());
    const size_t logged = capture_.text().size();
    Dictionary action{{"message", "m"}, {"logType", "syslog"}};
    if (c.level) action.set("logLevel", *c.level);
    Run(action);
    const auto records = Records();
    ASSERT_EQ(records.size(), 1u);
    EXPECT_EQ(records[0].priority, c.priority);
    const std::string text = capture_.text().substr(logged);
    EXPECT_EQ(text.find(complaint) != std::string::npos, c.complains) << text;
  }
}

TEST_F(LogActionTest, SendsKvlogDetailsAndALiteralFacilityWithTheMessageIntact) {
  Run(Dictionary{{"message", "%s%n ${global:who}"},
                 {"logType", "kvlog"},
                 {"facility", "${global:who}"},
                 {"details", Dictionary{{"user", "${global:who}"}, {"n", Value::Integer(2)}}}});
  const auto records = Records();
  ASSERT_EQ(records.size(), 1u);
  EXPECT_EQ(records[0].message, "%s%n root");
  const std::vector<std::pair<std::string, std::string>> expected = {
      {"Facility", "${global:who}"}, {"user", "root"}, {"n", "2"}};
  EXPECT_EQ(records[0].attributes, expected);

  // A detail named like the facility attribute replaces it: one attribute per name.
  Run(Dictionary{{"message", "m"},
                 {"logType", "kvlog"},
                 {"facility", "f"},
                 {"details", Dictionary{{"a", "1"}, {"Facility", "${global:who}"}}}});
  ASSERT_EQ(Records().size(), 2u);
  const std::vector<std::pair<std::string, std::string>> replaced = {{"Facility", "root"},
                                                                     {"a", "1"}};
  EXPECT_EQ(Records()[1].attributes, replaced);
}

TEST_F(LogActionTest, RefusesKvlogDetailsThatAreNoDictionaryButSyslogIgnoresThem) {
  Run(Dictionary{{"message", "m"}, {"logType", "kvlog"}, {"details", "text"}});
  EXPECT_TRUE(Records().empty());
  EXPECT_NE(capture_.text().find("The value for details is not a dictionary. Aborting log action."),
            std::string::npos);
  Run(Dictionary{{"message", "m"}, {"logType", "syslog"}, {"details", "text"}});
  ASSERT_EQ(Records().size(), 1u);
  EXPECT_TRUE(Records()[0].attributes.empty());
}

}  // namespace
}  // namespace tarvod
