// Rules run end to end in the real daemon. Tests that read runs of consecutive log lines use
// the "shutdown" event: while startup's rules run, the main thread writes lines between theirs.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>

#include <cstdio>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "harness.h"
#include "platform/testing/json_lines.h"
#include "rules_xml.h"

namespace tarvod::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

class DispatchTest : public TarvodTest {
 protected:
  void send(const std::vector<std::string>& typeAndPairs) {
    std::vector<std::string> args{"send", "--socket", socket};
    args.insert(args.end(), typeAndPairs.begin(), typeAndPairs.end());
    const RunResult result = Tarvodctl(args);
    EXPECT_EQ(result.status, 0) << result.err;
  }
  // The records of one event type; nullopt: the kvlog records, which have none.
  std::vector<JsonRecord> recordsOf(const std::optional<std::string>& type,
                                    const std::string& path = {}) const {
    std::vector<JsonRecord> found;
    for (const auto& record : ReadJsonRecords(path.empty() ? records : path)) {
      EXPECT_TRUE(record.parsed);
      if (record.attribute("eventType") == type) found.push_back(record);
    }
    return found;
  }
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

// The rule for the shorter prefix comes first in the file; it still runs second. A prefix
// whose rules all fail is recorded as blocked; a type without rules is dropped.
TEST_F(DispatchTest, RunsTheLongerPrefixFirstAndRecordsEachMatchedPrefix) {
  const std::string log =
      run({RuleXml("on startup", {"startup"}, {{"actions", Arr({FileLog("startup rule", out)})}}),
           RuleXml("on load", {"startup.load"},
                   {{"criterion", Arr({Criterion("equal", {Int(1), Int(2)})})},
                    {"actions", Arr({FileLog("load rule", out)})}})},
          2);
  EXPECT_EQ(ReadFile(out), "startup rule\n");
  EXPECT_LT(log.find("  Processing event: startup.load\n"),
            log.find("  Processing event: startup\n"));
  EXPECT_LT(log.find("PROCESSING RULE: on load"), log.find("PROCESSING RULE: on startup"));
  EXPECT_THAT(log, Not(HasSubstr("Dropping event startup.load because")));

  const auto load = recordsOf("startup.load");
  ASSERT_EQ(load.size(), 2u);
  EXPECT_EQ(load[0].attribute("eventBlocked"), "true");
  EXPECT_EQ(load[1].attribute("eventBlocked"), "false");
  for (const auto& record : load) {
    EXPECT_EQ(record.attribute("hasRules"), "true");
    EXPECT_EQ(record.attribute("eventSource"), "tarvod");
  }
  EXPECT_THAT(log, HasSubstr("  Dropping event shutdown because it has no associated rules\n"));
  const auto shutdown = recordsOf("shutdown");
  ASSERT_EQ(shutdown.size(), 1u);
  EXPECT_EQ(shutdown[0].attribute("hasRules"), "false");
  EXPECT_EQ(shutdown[0].attribute("eventBlocked"), "false");
}

// Each type counts its events since the rules were loaded; with keepLogFilesOpen, log files
// and the records file follow a rename (as logrotate does) at the next event and at a reload.
TEST_F(DispatchTest, CountsEachTypeSinceTheRulesWereLoadedAndKeptFilesFollowARotation) {
  const auto rotate = [](const std::string& path, const std::string& to) {
    ASSERT_EQ(std::rename(path.c_str(), to.c_str()), 0);
  };
  run({RuleXml("load", {"startup.load"},
               {{"actions", Arr({FileLog("${startup.load:eventCounter}", out)})}}),
       RuleXml("any startup", {"startup"},
               {{"actions", Arr({FileLog("s${startup:eventCounter}", out)})}})},
      1, {{"keepLogFilesOpen", Bool(true)}}, [&](Daemon& daemon) {
        ASSERT_TRUE(daemon.waitForLine(out, "s1\n"));
        rotate(out, out + ".1");
        rotate(records, records + ".1");
        send({"startup.load"});
        ASSERT_TRUE(daemon.waitForLine(out, "s2\n"));
        send({"startup.reload"});
        ASSERT_TRUE(daemon.waitForLine(out, "s3\n"));
        rotate(out, out + ".2");
        kill(daemon.pid(), SIGHUP);
        ASSERT_TRUE(daemon.waitForLine(out, "s1\n"));  // the reloaded rules count afresh
      });
  EXPECT_EQ(ReadFile(out + ".1"), "1\ns1\n");
  EXPECT_EQ(ReadFile(out + ".2"), "2\ns2\ns3\n");
  EXPECT_EQ(ReadFile(out), "s1\n");
  // Two records per event, one per matched prefix: none lost or doubled.
  EXPECT_EQ(recordsOf("startup.load", records + ".1").size() + recordsOf("startup.load").size(),
            4u);
  EXPECT_EQ(recordsOf("startup.reload").size(), 4u);
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
                                     Dict({{"type", Str("sendfax")}}), Dict({})})}})},
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
}

// A password stored with tarvodctl reaches the rules; nothing the daemon writes shows it.
TEST_F(DispatchTest, KeychainValuesReachRulesButNoLogShowsThem) {
  const std::string store = dir.file("etc/system.keychain");
  const std::string secret = "Hunter2-s3cr3t";
  auto keychain = [&](std::vector<std::string> args, std::string_view input = {}) {
    args.insert(args.begin(), {"keychain", "--keychain", store});
    return Tarvodctl(args, input);
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
      6, {{"keychainPath", Str(store)}, {"logEvents", Int(1)}, {"eventLogPath", Str(eventLog)}},
      [&](Daemon& daemon) {
        send({"test.secret", "guess=wrong"});
        EXPECT_TRUE(daemon.waitForLine(errorLog, "Globals = "));
      });

  for (const std::string& written : {log, ReadFile(eventLog), ReadFile(records), ReadFile(out)}) {
    EXPECT_THAT(written, Not(HasSubstr(secret)));
  }
  // The password was there to be hidden: the rule fired with it.
  EXPECT_EQ(ReadFile(out), "file <keychain value>\n");
  EXPECT_THAT(log, HasSubstr("  Set variable: line = pass <keychain value>\n"));
  const auto kv = recordsOf(std::nullopt);
  ASSERT_EQ(kv.size(), 1u);
  EXPECT_EQ(kv[0].message, "record <keychain value>");
  EXPECT_EQ(kv[0].attribute("pw"), "<keychain value>");
}

// tarvodctl refuses to touch the store unless it runs as root and the store is root's alone,
// and never rewrites a store it cannot read.
TEST_F(DispatchTest, TarvodctlKeychainRefusals) {
  const std::string store = dir.write("system.keychain", "not a property list");
  chmod(store.c_str(), 0600);
  auto keychain = [&](std::vector<std::string> args, std::string_view input = {}) {
    args.insert(args.begin(), {"keychain", "--keychain", store});
    return Tarvodctl(args, input);
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
