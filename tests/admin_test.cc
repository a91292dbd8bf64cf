// The administrator's tools against real files: tarvodctl check and test load the rules with
// the daemon's own loader and engine.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "harness.h"
#include "rules_xml.h"

namespace tarvod::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

class AdminTest : public TarvodTest {};

TEST_F(AdminTest, CheckReportsBrokenFilesAndPassesTheExamples) {
  const std::string config = dir.write(
      "tarvod.plist",
      ConfigPlist({{"debugLevl", Int(1)},
                   {"periodicEvents",
                    Arr({Dict({{"eventType", Str("tick")}, {"startInterval", Int(0)}})})}}));
  dir.write(
      "rules.d/ssh.plist",
      RulesDocument({RuleXml("count", {"auth.failure"}),
                     RuleXml("ban", {"auth.failure"}, {{"critera", Arr({Criterion("true")})}})}));
  dir.write("rules.d/root.plist", PlistDocument(Dict({{"name", Str("x")}})));
  dir.write("rules.d/broken.plist", "<plist><array><dict>");
  dir.write("rules.d/ssh.plist~", RulesDocument({RuleXml("old", {"auth.failure"})}));

  const RunResult result = Tarvodctl({"check", "-c", config, "-r", dir.file("rules.d")});
  EXPECT_EQ(result.status, 1);
  const std::string rules = dir.file("rules.d/");
  EXPECT_EQ(result.out,
            config + ": config.debugLevl: unknown key, ignored (did you mean \"debugLevel\"?)\n" +
                config +
                ": config.periodicEvents[1].startInterval: \"0\" is not a positive number of "
                "seconds; no timer is created\n" +
                rules + "broken.plist: cannot be read as a property list; skipped\n" + rules +
                "root.plist: the top level is not an array of rules; skipped\n" + rules +
                "ssh.plist: rule 2 \"ban\": critera: unknown key, ignored (did you mean "
                "\"criterion\"?)\n" +
                rules +
                "ssh.plist~: warning: an editor's or package manager's leftover; skipped\n"
                "1 files read, 2 rules loaded, 3 files skipped, 5 errors, 1 warnings\n");
  const RunResult json = Tarvodctl({"check", "--json", "-c", config, "-r", dir.file("rules.d")});
  EXPECT_THAT(json.out, HasSubstr("\"errors\": 5, \"warnings\": 1"));
  EXPECT_THAT(json.out, HasSubstr("\"rule\": 2, \"name\": \"ban\", \"key\": \"critera\""));

  // Warnings fail only with --strict.
  const std::string clean = dir.write("clean.plist", RulesDocument({RuleXml("none", {})}));
  EXPECT_EQ(Tarvodctl({"check", "-c", dir.file("none"), "-r", clean}).status, 0);
  EXPECT_EQ(Tarvodctl({"check", "--strict", "-c", dir.file("none"), "-r", clean}).status, 1);

  // Every key the README documents is one the check knows.
  std::ifstream readme(std::string(TARVOD_SOURCE_DIR) + "/README.md");
  ConfigEntries documented;
  bool inTable = false;
  for (std::string line; std::getline(readme, line);) {
    inTable = line.starts_with("| `debugLevel` |") || (inTable && line.starts_with("| `"));
    if (!inTable) continue;
    const std::string key = line.substr(3, line.find('`', 3) - 3);
    const std::string type = line.substr(line.find("| ", 3) + 2, 6);
    if (type == "string") documented.push_back({key, Str(key == "authLogSource" ? "none" : "1")});
    if (type == "intege" || type == "boolea") documented.push_back({key, Int(1)});
  }
  EXPECT_GE(documented.size(), 19u);
  const std::string everyKey = dir.write("every.plist", ConfigPlist(documented));
  const RunResult every = Tarvodctl({"check", "-c", everyKey, "-r", clean});
  EXPECT_EQ(every.status, 0) << every.out;

  for (const char* examples : {"examples/rules", "examples/rulesets"}) {
    const RunResult example = Tarvodctl({"check", "--strict", "-c",
                                         std::string(TARVOD_SOURCE_DIR) + "/examples/tarvod.plist",
                                         "-r", std::string(TARVOD_SOURCE_DIR) + "/" + examples});
    EXPECT_EQ(example.status, 0) << example.out;
    EXPECT_THAT(example.out, HasSubstr(" 0 errors, 0 warnings\n"));
  }
}

TEST_F(AdminTest, TestShowsWhatARuleWouldDoAndDoesNothing) {
  const std::string written = dir.file("written.log");
  const std::string touched = dir.file("touched");
  const std::string rules = dir.write(
      "rules.plist",
      RulesDocument({RuleXml(
          "ban", {"auth.failure"},
          {{"criterion", Arr({Criterion("greaterThan", {Str("${global:count}"), Int(1)})})},
           {"variables", Dict({{"global:count", Str("${global:count} + 1")}})},
           {"actions", Arr({FileLog("ban ${event:clientIP}", written),
                            Dict({{"type", Str("runcommand")},
                                  {"command", Str("/usr/bin/touch")},
                                  {"arguments", Arr({Str(touched)})}})})}})}));
  const std::string config = dir.write("tarvod.plist", ConfigPlist({}, Dict({{"count", Int(2)}})));

  const RunResult fires =
      Tarvodctl({"test", "-c", config, "-r", rules, "auth.failure.ssh", "clientIP=192.0.2.7"});
  EXPECT_EQ(fires.status, 0) << fires.err;
  EXPECT_EQ(fires.out,
            "type prefix auth.failure: 1 rules\n"
            "rule \"ban\" (" +
                rules +
                ")\n"
                "  criterion: 2 (integer) greaterthan 1 (string): passed\n"
                "  fires\n"
                "  sets global:count = 3\n"
                "  action log: would append to " +
                written +
                ": ban 192.0.2.7\n"
                "  action runcommand: would run /usr/bin/touch \"" +
                touched + "\" as user ID 99, group ID 99, in /\n");
  EXPECT_FALSE(FileExists(written));
  EXPECT_FALSE(FileExists(touched));

  const std::string quiet = dir.write("quiet.plist", ConfigPlist({}, Dict({{"count", Int(0)}})));
  const RunResult skipped = Tarvodctl({"test", "-c", quiet, "-r", rules, "auth.failure"});
  EXPECT_THAT(skipped.out, HasSubstr("  criterion: 0 (integer) greaterthan 1 (string): failed\n"
                                     "  does not fire\n"));
  EXPECT_THAT(skipped.out, Not(HasSubstr("action")));
}

// Each example rule set, run from the saved counts its comment speaks of, does what the
// comment promises.
TEST_F(AdminTest, ExampleRuleSetsDoWhatTheirCommentsSay) {
  const std::string sets = std::string(TARVOD_SOURCE_DIR) + "/examples/rulesets/";
  const std::string config = dir.write(
      "tarvod.plist", ConfigPlist({{"saveState", "<true/>"}, {"stateDirectory", Str(dir.path())}},
                                  Dict({{"adminEmail", Str("admin@example.com")},
                                        {"pagerAddress", Str("pager@example.com")}})));
  dir.write("state",
            PlistDocument(Dict(
                {{sets + "ssh-bruteforce.plist",
                  Dict({{"failures_192.0.2.7", Int(4)}, {"failures_2001\\:db8\\:\\:1", Int(4)}})},
                 {sets + "sudo-failures.plist", Dict({{"sudo_alice", Int(2)}})},
                 {sets + "disk-space.plist", Dict({{"full_/var", Str("yes")}})}})));
  struct Case {
    std::string file;
    std::vector<std::string> event;
    std::vector<std::string> expected;
  };
  const Case cases[] = {
      {"ssh-bruteforce.plist",
       {"auth.failure", "clientIP=192.0.2.7", "username=bob"},
       {"sets failures_192.0.2.7 = 0",
        "banning 192.0.2.7 after 5 failed SSH logins (last user bob)",
        "would run /usr/sbin/nft \"add\" \"element\" \"inet\" \"filter\" \"tarvod_ban4\" "
        "\"{ 192.0.2.7 }\" as user ID 0"}},
      {"ssh-bruteforce.plist",
       {"auth.failure", "clientIP=2001:db8::1"},
       {"\"tarvod_ban6\" \"{ 2001:db8::1 }\""}},
      {"ssh-bruteforce.plist",
       {"auth.failure", "clientIP=198.51.100.1"},
       {"sets failures_198.51.100.1 = 1\nrule \"Ban an IPv4 address at its fifth failure\"",
        "failed\n  does not fire\nrule \"Ban an IPv6"}},
      {"ssh-bruteforce.plist",
       {"ssh.unban"},
       {"nft flush set inet filter tarvod_ban4; /usr/sbin/nft flush set inet filter tarvod_ban6"}},
      {"sudo-failures.plist",
       {"sudo.failure", "user=alice"},
       {"sets sudo_alice = 0", "action sendemail: would mail admin@example.com",
        "subject \"sudo: 3 failed attempts by alice on "}},
      {"disk-space.plist", {"disk.check"}, {"df -P", "as user ID 65534"}},
      {"disk-space.plist",
       {"disk.usage", "percent=93", "mount=/"},
       {"sets full_/ = yes", "action sendpage: would mail pager@example.com", "/ is 93% full"}},
      {"disk-space.plist",
       {"disk.usage", "percent=95", "mount=/var"},
       {"notequal yes (string): failed\n  does not fire"}},
      {"disk-space.plist", {"disk.usage", "percent=40", "mount=/var"}, {"sets full_/var = no"}},
      {"notification-relay.plist",
       {"job.finished", "job=backup", "status=failed"},
       {"would post com.example.jobs with object \"job.failed\"", "eventType = job.failed;"}},
      {"notification-relay.plist", {"job.finished", "job=backup", "status=ok"}, {"does not fire"}},
      {"notification-relay.plist",
       {"job.failed", "job=backup", "status=failed"},
       {"would send to the structured log (kvlog, level error): job backup ended with failed"}},
  };
  for (const Case& c : cases) {
    std::vector<std::string> args = {"test", "-c", config, "-r", sets + c.file};
    args.insert(args.end(), c.event.begin(), c.event.end());
    const RunResult result = Tarvodctl(args);
    EXPECT_EQ(result.status, 0) << result.err;
    for (const std::string& text : c.expected) {
      EXPECT_THAT(result.out, HasSubstr(text)) << c.file << " " << c.event[0];
    }
    EXPECT_EQ(result.err, "") << c.file << " " << c.event[0];
  }
}

TEST_F(AdminTest, StatsCountWhatWasSentAndAnswerRootOnly) {
  Daemon& daemon =
      start({RuleXml("odd", {"auth.failure"},
                     {{"criterion", Arr({Criterion("equal", {Str("${event:n}"), Str("1")})})},
                      {"actions", Arr({FileLog("x", dir.file("missing/x.log"))})}})},
            1);
  const std::string config = dir.file("tarvod.plist");
  for (const char* n : {"1", "2", "1"}) {
    ASSERT_EQ(Tarvodctl({"-c", config, "send", "auth.failure.ssh", std::string("n=") + n}).status,
              0);
  }
  ASSERT_TRUE(daemon.waitForLine(errorLog, "LOG: Cannot open"));
  RunResult stats;
  for (int i = 0; i < 50; ++i) {
    stats = Tarvodctl({"-c", config, "stats"});
    if (stats.out.find("\"run\": 2") != std::string::npos) break;
    std::this_thread::sleep_for(100ms);
  }
  EXPECT_EQ(stats.status, 0) << stats.err;
  EXPECT_THAT(stats.out, HasSubstr("\"rulesLoaded\": 1,"));
  EXPECT_THAT(stats.out, HasSubstr("\"auth.failure\": 3"));
  EXPECT_THAT(stats.out, HasSubstr("\"eventsPerSource\": {\"socket\": 3, \"sshLogins\": 0, "
                                   "\"notifications\": 0, \"periodic\": 0, \"daemon\": 1}"));
  EXPECT_THAT(stats.out, HasSubstr("{\"name\": \"odd\", \"file\": \"" + rulesPath +
                                   "\", \"runs\": 3, \"fired\": 2,"));
  EXPECT_THAT(stats.out, HasSubstr("\"log\": {\"run\": 2, \"failed\": 2}"));
  EXPECT_THAT(Tarvodctl({"-c", config, "status"}).out, HasSubstr(" 1 rules loaded, "));

  // A second daemon on the same socket says so on standard error.
  Daemon second({"-c", config, "-r", rulesPath, "-n"}, dir);
  const std::string held =
      "tarvod: the event socket cannot be opened: another process listens on " + socket;
  for (int i = 0; i < 100 && second.stderrText().find(held) == std::string::npos; ++i) {
    std::this_thread::sleep_for(50ms);
  }
  EXPECT_THAT(second.stderrText(), HasSubstr(held));
  EXPECT_EQ(second.stop(), 0);

  // Anyone else is turned away, by the socket's mode and by the daemon. (Root can be anyone.)
  if (geteuid() != 0) return;
  const RunResult other = RunProgram({"/usr/bin/setpriv", "--reuid=65534", "--regid=65534",
                                      "--clear-groups", TarvodctlBinary(), "-c", config, "stats"});
  EXPECT_EQ(other.status, 1);
  EXPECT_THAT(other.err, HasSubstr("Permission denied"));
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace tarvod::testing
