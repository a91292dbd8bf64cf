// Rules run end to end in the real daemon: prefix order, records, the event counter, the three
// criterion modes, variables, action dispatch and the file log action. The daemon's own
// "startup.load" event (and events sent through the event socket) drive the rules. Tests that
// read runs of consecutive log lines use the "shutdown" event: while startup's rules run, the
// main thread is still writing its own lines between theirs.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>

#include <cstdio>
#include <functional>
#include <string>
#include <vector>

#include "harness.h"
#include "platform/testing/json_lines.h"
#include "rules_xml.h"

namespace tarvod::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

class DispatchTest : public ::testing::Test {
 protected:
  // Runs the daemon over the rules until its startup event is in, lets whileRunning act, then
  // stops it (the shutdown event's rules run before it exits). Returns the error log.
  std::string run(const std::vector<std::string>& rules, int level,
                  const std::function<void(Daemon&)>& whileRunning = {}) {
    std::vector<std::pair<std::string, std::string>> settings{{"errorLogPath", Str(errorLog)},
                                                              {"structuredLogPath", Str(records)},
                                                              {"eventSocketPath", Str(socket)},
                                                              {"stateDirectory", Str(dir.path())}};
    settings.insert(settings.end(), extraConfig.begin(), extraConfig.end());
    const std::string config = dir.write("tarvod.plist", ConfigPlist(settings));
    dir.write("rules.plist", RulesDocument(rules));
    Daemon daemon({"-c", config, "-r", rulesPath, "-v", std::to_string(level), "-n"}, dir);
    EXPECT_TRUE(daemon.waitForLine(errorLog, "EVENT RECEIVED: startup.load"))
        << daemon.stderrText();
    if (whileRunning) whileRunning(daemon);
    EXPECT_EQ(daemon.stop(), 0);
    return ReadFile(errorLog);
  }

  void send(const std::vector<std::string>& typeAndPairs) {
    std::vector<std::string> argv{TarvodctlBinary(), "send", "--socket", socket};
    argv.insert(argv.end(), typeAndPairs.begin(), typeAndPairs.end());
    RunResult result;
    // The listener comes up just after the startup event is raised.
    for (int attempt = 0; attempt < 50; ++attempt) {
      result = RunProgram(argv);
      if (result.status == 0) return;
      usleep(100000);
    }
    ADD_FAILURE() << result.err;
  }

  std::vector<JsonRecord> recordsOf(const std::string& type) const {
    std::vector<JsonRecord> found;
    for (const auto& record : ReadJsonRecords(records)) {
      EXPECT_TRUE(record.parsed);
      if (record.attribute("eventType") == type) found.push_back(record);
    }
    return found;
  }

  TempDir dir;
  std::vector<std::pair<std::string, std::string>> extraConfig;  // more config entries for run
  const std::string errorLog = dir.file("error.log");
  const std::string records = dir.file("records.jsonl");
  const std::string socket = dir.file("evtq");
  const std::string rulesPath = dir.file("rules.plist");
  const std::string out = dir.file("out.log");
};

// The text from the line starting with `from` up to (not including) the next "PROCESSING RULE".
std::string RuleSection(const std::string& log, const std::string& rule) {
  const size_t start = log.find("PROCESSING RULE: " + rule + " (");
  if (start == std::string::npos) return {};
  const size_t end = log.find("PROCESSING RULE: ", start + 1);
  return log.substr(start, end == std::string::npos ? std::string::npos : end - start);
}

// "P" and "F" for the "Passed" and "Failed" lines of a section, in order.
std::string Verdicts(const std::string& section) {
  std::string verdicts;
  for (size_t at = section.find("\n      "); at != std::string::npos;
       at = section.find("\n      ", at + 1)) {
    if (section.compare(at + 7, 7, "Passed\n") == 0) verdicts += 'P';
    if (section.compare(at + 7, 7, "Failed\n") == 0) verdicts += 'F';
  }
  return verdicts;
}

TEST_F(DispatchTest, RunsTheLongerPrefixFirstAndRecordsEachMatchedPrefix) {
  // The rule for the shorter prefix comes first in the file; it still runs second.
  const std::string log =
      run({RuleXml("on startup", {"startup"},
                   {{"actions", Arr({FileLog("startup rule ${startup:eventCounter}", out)})}}),
           RuleXml("on load", {"startup.load"}, {{"actions", Arr({FileLog("load rule", out)})}})},
          2);
  EXPECT_EQ(ReadFile(out), "load rule\nstartup rule 1\n");
  EXPECT_LT(log.find("  Processing event: startup.load\n"),
            log.find("  Processing event: startup\n"));
  EXPECT_LT(log.find("PROCESSING RULE: on load"), log.find("PROCESSING RULE: on startup"));

  const auto load = recordsOf("startup.load");
  ASSERT_EQ(load.size(), 2u);
  for (const auto& record : load) {
    EXPECT_EQ(record.attribute("hasRules"), "true");
    EXPECT_EQ(record.attribute("eventBlocked"), "false");
    EXPECT_EQ(record.attribute("eventSource"), "tarvod");
    EXPECT_EQ(record.attribute("Level"), "Alert");
    EXPECT_TRUE(record.attribute("Time") && record.attribute("TimeNanoSec"));
  }
  // The shutdown event has no rules: dropped, and recorded once.
  EXPECT_THAT(log, HasSubstr("  Dropping event shutdown because it has no associated rules\n"));
  const auto shutdown = recordsOf("shutdown");
  ASSERT_EQ(shutdown.size(), 1u);
  EXPECT_EQ(shutdown[0].attribute("hasRules"), "false");
  EXPECT_EQ(shutdown[0].attribute("eventBlocked"), "false");
}

TEST_F(DispatchTest, DropsPrefixesWithoutRulesAndMarksAnEventBlockedWhenNoRuleFires) {
  const std::string log = run({RuleXml("never", {"startup"},
                                       {{"criterion", Arr({Criterion("equal", {Int(1), Int(2)})})},
                                        {"actions", Arr({FileLog("fired", out)})}})},
                              2);
  EXPECT_THAT(log, HasSubstr("  Dropping event startup.load because it has no associated rules\n"));
  EXPECT_THAT(log, Not(HasSubstr("Dropping event startup because")));
  EXPECT_FALSE(FileExists(out));
  const auto load = recordsOf("startup.load");
  ASSERT_EQ(load.size(), 2u);
  // First the full type without rules, then the "startup" prefix after its rule ran.
  EXPECT_EQ(load[0].attribute("hasRules"), "false");
  EXPECT_EQ(load[0].attribute("eventBlocked"), "false");
  EXPECT_EQ(load[1].attribute("hasRules"), "true");
  EXPECT_EQ(load[1].attribute("eventBlocked"), "true");
}

TEST_F(DispatchTest, CountsTheEventsOfEachTypeSinceTheRulesWereLoaded) {
  run({RuleXml("load", {"startup.load"},
               {{"actions", Arr({FileLog("${startup.load:eventCounter}", out)})}}),
       RuleXml("any startup", {"startup"},
               {{"actions", Arr({FileLog("s${startup:eventCounter}", out)})}})},
      1, [&](Daemon& daemon) {
        send({"startup.load"});
        ASSERT_TRUE(daemon.waitForLine(out, "s2\n"));
        send({"startup.load"});
        ASSERT_TRUE(daemon.waitForLine(out, "s3\n"));
        send({"startup.reload"});
        ASSERT_TRUE(daemon.waitForLine(out, "s4\n"));
      });
  EXPECT_EQ(ReadFile(out), "1\ns1\n2\ns2\n3\ns3\ns4\n");
}

// With keepLogFilesOpen, a log file renamed away (as logrotate does) is followed at the next
// event, and after a reload; so is the records file, which is always kept open.
TEST_F(DispatchTest, KeptLogFilesAndTheRecordsFileFollowARotationByRenaming) {
  extraConfig = {{"keepLogFilesOpen", Bool(true)}};
  const auto rotate = [](const std::string& path, const std::string& to) {
    ASSERT_EQ(std::rename(path.c_str(), to.c_str()), 0);
  };
  run({RuleXml("any startup", {"startup"},
               {{"actions", Arr({FileLog("s${startup:eventCounter}", out)})}})},
      1, [&](Daemon& daemon) {
        ASSERT_TRUE(daemon.waitForLine(out, "s1\n"));
        rotate(out, out + ".1");
        rotate(records, records + ".1");
        send({"startup.load"});
        ASSERT_TRUE(daemon.waitForLine(out, "s2\n"));
        rotate(out, out + ".2");
        kill(daemon.pid(), SIGHUP);
        ASSERT_TRUE(daemon.waitForLine(out, "s1\n"));  // the reloaded rules count afresh
      });
  EXPECT_EQ(ReadFile(out + ".1"), "s1\n");
  EXPECT_EQ(ReadFile(out + ".2"), "s2\n");
  EXPECT_EQ(ReadFile(out), "s1\n");
  // Two records per startup event (the full type has no rules), none lost or doubled.
  size_t load = 0;
  for (const auto& record : ReadJsonRecords(records + ".1")) {
    load += record.attribute("eventType") == "startup.load";
  }
  load += recordsOf("startup.load").size();
  EXPECT_EQ(load, 4u);
  EXPECT_EQ(recordsOf("startup.reload").size(), 2u);
}

TEST_F(DispatchTest, EvaluatesCriteriaInAnyAllAndUnconditionalModes) {
  const std::string fail1 = Criterion("equal", {Int(1), Int(2)});
  const std::string fail2 = Criterion("equal", {Int(3), Int(4)});
  const std::string pass = Criterion("true");
  const std::string log =
      run({RuleXml("any", {"shutdown"},
                   {{"allowPartialCriterionMatch", Bool(true)},
                    {"criterion", Arr({fail1, pass, fail2})},
                    {"actions", Arr({FileLog("any fired", out)})}}),
           RuleXml("all", {"shutdown"},
                   {{"criterion", Arr({pass, fail1, pass})},
                    {"actions", Arr({FileLog("all fired", out)})}}),
           RuleXml("none", {"shutdown"}, {{"actions", Arr({FileLog("none fired", out)})}}),
           RuleXml("any failing", {"shutdown"},
                   {{"allowPartialCriterionMatch", Bool(true)},
                    {"criterion", Arr({fail1, fail2})},
                    {"actions", Arr({FileLog("any failing fired", out)})}}),
           // Only the boolean true selects "any"; the text "true" does not.
           RuleXml("text true", {"shutdown"},
                   {{"allowPartialCriterionMatch", Str("true")},
                    {"criterion", Arr({pass, fail1})},
                    {"actions", Arr({FileLog("text true fired", out)})}})},
          3);
  EXPECT_EQ(ReadFile(out), "any fired\nnone fired\n");

  const std::string any = RuleSection(log, "any");
  EXPECT_THAT(any, HasSubstr("\n  Rule will fire if any criteria passes.\n"));
  EXPECT_EQ(Verdicts(any), "FP");  // the third entry is never evaluated
  EXPECT_THAT(any, HasSubstr("\n  Criterion passed. Executing rule.\n"));

  const std::string all = RuleSection(log, "all");
  EXPECT_THAT(all, HasSubstr("\n  All criterion must pass for the rule to fire.\n"));
  EXPECT_EQ(Verdicts(all), "PF");
  EXPECT_THAT(all, HasSubstr("\n  Criterion did not pass. Skipping rule.\n\n"));

  const std::string none = RuleSection(log, "none");
  EXPECT_THAT(none, HasSubstr("\n  No criterion to evaluate. Rule will fire.\n"));
  EXPECT_EQ(Verdicts(none), "");

  EXPECT_EQ(Verdicts(RuleSection(log, "any failing")), "FF");
  const std::string text = RuleSection(log, "text true");
  EXPECT_THAT(text, HasSubstr("\n  All criterion must pass for the rule to fire.\n"));
  EXPECT_EQ(Verdicts(text), "PF");
}

TEST_F(DispatchTest, AssignsFileVariablesThenRuleVariablesInKeyOrderBeforeTheActions) {
  const std::string variablesFile =
      dir.write("vars.plist", PlistDocument(Dict({{"b", Str("file b")}, {"a", Str("file a")}})));
  const std::string missing = dir.file("missing.plist");
  const std::string log =
      run({RuleXml("vars", {"shutdown"},
                   {{"loadVariablesFromFile", Str(variablesFile)},
                    // n2 sorts after n1 and sees its new value; c sees the rule's b.
                    {"variables", Dict({{"n2", Str("${n1} + 1")},
                                        {"c", Str("${b}+${a}")},
                                        {"b", Str("rule b")},
                                        {"n1", Int(1)}})},
                    {"actions", Arr({FileLog("${a}|${b}|${c}|${n2}", out)})}}),
           RuleXml("missing file", {"shutdown"},
                   {{"loadVariablesFromFile", Str(missing)},
                    {"actions", Arr({FileLog("still ran", out)})}})},
          4);
  EXPECT_EQ(ReadFile(out), "file a|rule b|rule b+file a|2\nstill ran\n");
  const std::string section = RuleSection(log, "vars");
  EXPECT_LT(section.find("    processing variables from file: " + variablesFile + ".\n"),
            section.find("    done processing variables from file\n"));
  EXPECT_LT(section.find("    done processing variables from file\n"),
            section.find("    processing variables from rule\n"));
  EXPECT_THAT(RuleSection(log, "missing file"),
              HasSubstr("ERROR: Unable to load vairables from " + missing +
                        "\n        failed to load variables from " + missing +
                        "\n    done processing variables from file\n"));
}

TEST_F(DispatchTest, DispatchesActionsByKeywordAndDumpsOnlyForExactData) {
  const auto dump = [](const char* type, const char* data) {
    return Dict({{"type", Str(type)}, {"data", Str(data)}});
  };
  const std::string log =
      run({RuleXml("dump", {"shutdown"},
                   {{"variables", Dict({{"global:marker", Str("m1")}})},
                    {"actions", Arr({dump("debugdump", "all"), dump("debugdump", "globals"),
                                     dump("debugdump", "rulebase"), dump("DebugDump", "All"),
                                     Dict({{"type", Str("sendfax")}}), Dict({}),
                                     Dict({{"type", Str("SendMessage")}}),
                                     Dict({{"type", Str("publishRSS")}})})}})},
          2);
  EXPECT_THAT(log, HasSubstr("  Executing action debugdump (13)\ninAction = {"));
  EXPECT_THAT(log, HasSubstr("\ninRule = {"));
  EXPECT_THAT(log, HasSubstr("\ninContext = event = {"));
  EXPECT_THAT(log, HasSubstr("  Executing action debugdump (13)\nGlobals = {"));
  EXPECT_THAT(log, HasSubstr("marker = m1;"));
  EXPECT_THAT(log, HasSubstr("  Executing action debugdump (13)\nRulebase = {"));
  EXPECT_THAT(log, HasSubstr("  Executing action DebugDump (13)\n\n"));
  EXPECT_THAT(log, HasSubstr("  Executing action sendfax (0)\n\n"));
  EXPECT_THAT(log, HasSubstr("  Executing action (null) (0)\n\n"));
  EXPECT_THAT(log, HasSubstr("  Executing action SendMessage (5)\n\n"));
  EXPECT_THAT(log, HasSubstr("  Executing action publishRSS (12)\n\n"));
}

TEST_F(DispatchTest, LogActionWritesFileLinesByteForByteAndStructuredMessagesIntact) {
  WriteFile(out, "before\n");
  const std::string message = "100%s%n \"quoted\" <tag> & done";
  run({RuleXml("log", {"startup.load"},
               {{"actions",
                 Arr({FileLog(message, out), FileLog("second\nline", out),
                      Dict({{"type", Str("log")},
                            {"logType", Str("KVLog")},
                            {"logLevel", Str("Warning")},
                            {"facility", Str("auth")},
                            {"message", Str(message)},
                            {"details", Dict({{"source", Str("${event:eventSource}")}})}})})}})},
      1);
  EXPECT_EQ(ReadFile(out), "before\n" + message + "\nsecond\nline\n");
  std::vector<JsonRecord> kv;
  for (const auto& record : ReadJsonRecords(records)) {
    if (!record.attribute("eventType")) kv.push_back(record);
  }
  ASSERT_EQ(kv.size(), 1u);
  EXPECT_EQ(kv[0].message, message);
  EXPECT_EQ(kv[0].priority, 4);
  const std::vector<std::pair<std::string, std::string>> attributes = {{"Facility", "auth"},
                                                                       {"source", "tarvod"}};
  EXPECT_EQ(kv[0].attributes, attributes);
}

// The administrator stores a password with tarvodctl; rules read it, and nothing the daemon
// writes shows it: not the error log at level 6, the event log, the records, a log action's
// file or a debugdump.
TEST_F(DispatchTest, KeychainValuesReachRulesButNoLogShowsThem) {
  const std::string store = dir.file("etc/system.keychain");
  const std::string secret = "Hunter2-s3cr3t";
  auto keychain = [&](std::vector<std::string> args, std::string_view input = {}) {
    args.insert(args.begin(), {TarvodctlBinary(), "keychain", "--keychain", store});
    return RunProgram(args, input);
  };
  RunResult result = keychain({"set", "mail.example.com", "relay"}, secret + "\n");
  ASSERT_EQ(result.status, 0) << result.err;
  ASSERT_EQ(keychain({"set", "old.example.com", "x"}, "gone").status, 0);
  EXPECT_EQ(keychain({"delete", "old.example.com", "x"}).status, 0);
  EXPECT_EQ(keychain({"get", "mail.example.com", "relay"}).out, secret + "\n");
  EXPECT_EQ(keychain({"list"}).out, "mail.example.com\trelay\n");
  result = keychain({"get", "old.example.com", "x"});
  EXPECT_EQ(result.status, 1);
  EXPECT_THAT(result.err, HasSubstr("no item for service 'old.example.com' and account 'x'"));
  struct stat info {};
  ASSERT_EQ(stat(store.c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 07777, 0600u);
  EXPECT_EQ(info.st_uid, 0u);

  const std::string eventLog = dir.file("events.log");
  extraConfig = {
      {"keychainPath", Str(store)}, {"logEvents", Int(1)}, {"eventLogPath", Str(eventLog)}};
  const std::string password = "${keychain:relay@mail.example.com}";
  const std::string log = run(
      {RuleXml(
          "uses the password", {"test.secret"},
          {{"criterion", Arr({Criterion("notequal", {Str(password), Str("${event:guess}")})})},
           {"variables", Dict({{"global:pw", Str(password)}, {"line", Str("pass " + password)}})},
           {"actions", Arr({FileLog("file " + password, out),
                            Dict({{"type", Str("log")},
                                  {"logType", Str("kvlog")},
                                  {"message", Str("record " + password)},
                                  {"details", Dict({{"pw", Str(password)}})}}),
                            Dict({{"type", Str("debugdump")}, {"data", Str("all")}}),
                            Dict({{"type", Str("debugdump")}, {"data", Str("globals")}})})}})},
      6, [&](Daemon& daemon) {
        send({"test.secret", "guess=wrong"});
        EXPECT_TRUE(daemon.waitForLine(errorLog, "Globals = "));
      });

  for (const std::string& written : {log, ReadFile(eventLog), ReadFile(records), ReadFile(out)}) {
    EXPECT_THAT(written, Not(HasSubstr(secret)));
  }
  // The password was there to be hidden: the rule fired with it.
  EXPECT_EQ(ReadFile(out), "file <keychain value>\n");
  EXPECT_THAT(log, HasSubstr("  Set variable: pw = <keychain value>\n"));
  EXPECT_THAT(log, HasSubstr("  Set variable: line = pass <keychain value>\n"));
  bool sawRecord = false;
  for (const auto& record : ReadJsonRecords(records)) {
    if (record.message != "record <keychain value>") continue;
    sawRecord = true;
    EXPECT_EQ(record.attribute("pw"), "<keychain value>");
  }
  EXPECT_TRUE(sawRecord);
}

// tarvodctl refuses to touch the store unless it runs as root and the store is root's alone,
// and never rewrites a store it cannot read.
TEST_F(DispatchTest, TarvodctlKeychainRefusals) {
  const std::string store = dir.write("system.keychain", "not a property list");
  chmod(store.c_str(), 0600);
  auto keychain = [&](std::vector<std::string> args, std::string_view input = {}) {
    args.insert(args.begin(), {TarvodctlBinary(), "keychain", "--keychain", store});
    return RunProgram(args, input);
  };
  RunResult result =
      RunProgram({"/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups",
                  TarvodctlBinary(), "keychain", "--keychain", store, "list"});
  EXPECT_EQ(result.status, 1);
  EXPECT_THAT(result.err, HasSubstr("tarvodctl: keychain commands must be run as root"));

  result = keychain({"set", "s", "a"}, "pw");
  EXPECT_EQ(result.status, 1);
  EXPECT_THAT(result.err, HasSubstr(store + " is not a property-list array"));
  EXPECT_EQ(ReadFile(store), "not a property list");

  chmod(store.c_str(), 0640);
  result = keychain({"list"});
  EXPECT_EQ(result.status, 1);
  EXPECT_THAT(result.err, HasSubstr("has group or other permission bits (mode 0640)"));

  std::remove(store.c_str());
  result = keychain({"set", "s", "a"}, "\n");
  EXPECT_EQ(result.status, 1);
  EXPECT_THAT(result.err, HasSubstr("the password is empty"));
  EXPECT_EQ(keychain({"get", "s"}).status, 2);
  EXPECT_EQ(keychain({"frob", "s", "a"}).status, 2);
}

}  // namespace
}  // namespace tarvod::testing
