// The daemon's start and stop: command line, configuration, logs and rule loading, observed
// through the real binary's exit status and error log.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>

#include "harness.h"
#include "rules_xml.h"

namespace tarvod::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

class DaemonTest : public TarvodTest {
 protected:
  std::string writeOneRule() const {
    return dir.write("rules/a.plist", RulesDocument({RuleXml("first", {"x.y"})}));
  }
  RunResult tarvod(const std::vector<std::string>& args) const {
    std::vector<std::string> argv{TarvodBinary()};
    argv.insert(argv.end(), args.begin(), args.end());
    return RunProgram(argv);
  }
};

TEST_F(DaemonTest, UsageErrorPrintsOnlyTheUsageLineAndExits255) {
  const RunResult result = tarvod({"-x"});
  EXPECT_EQ(result.status, 255);
  EXPECT_EQ(result.err, "Usage: " + TarvodBinary() +
                            " [ -r <rules.plist>] [-c <config file> ] [-v <debug level>] [-n]\n");
  EXPECT_EQ(result.out, "");
}

TEST_F(DaemonTest, QuitsWithStatusZeroWhenNoRulesAreFound) {
  const std::string config = writeConfig();
  mkdir(dir.file("empty").c_str(), 0755);
  for (const std::string& rules : {dir.file("empty"), dir.file("missing")}) {
    const RunResult result = tarvod({"-c", config, "-r", rules});
    EXPECT_EQ(result.status, 0) << result.err;
    const std::string log = ReadFile(errorLog);
    EXPECT_THAT(log, HasSubstr("No rules found in " + rules + ", quitting....\n"));
    EXPECT_THAT(log, HasSubstr("Velkin Shutdown at "));
  }
  struct stat st {};
  ASSERT_EQ(stat(errorLog.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
}

TEST_F(DaemonTest, DebugLevelComesFromTheCommandLineUnlessItIsZero) {
  const std::string rules = dir.file("empty");
  mkdir(rules.c_str(), 0755);
  const struct {
    std::string option;
    long configured;
    bool expectLevel1;
    bool expectLevel4;
  } cases[] = {{"0", 1, true, false}, {"4", 1, true, true}, {"-1", 6, false, false}};
  for (const auto& c : cases) {
    SCOPED_TRACE("-v " + c.option);
    std::remove(errorLog.c_str());
    const std::string config = writeConfig({{"debugLevel", Int(c.configured)}});
    ASSERT_EQ(tarvod({"-c", config, "-r", rules, "-v", c.option}).status, 0);
    const std::string log = ReadFile(errorLog);
    EXPECT_EQ(log.find("Loaded 0 rules") != std::string::npos, c.expectLevel1);
    EXPECT_EQ(log.find("Velkin rules path is") != std::string::npos, c.expectLevel4);
    // Level-0 messages are written unless the level is negative.
    EXPECT_EQ(log.find("Velkin Started") != std::string::npos, c.option != "-1");
  }
}

TEST_F(DaemonTest, SymbolicLinkAtTheErrorLogPathIsRefusedAndAHardLinkAppendedTo) {
  const std::string target = dir.write("target.log", "existing\n");
  const std::string config = writeConfig();
  ASSERT_EQ(symlink(target.c_str(), errorLog.c_str()), 0);
  RunResult result = tarvod({"-c", config, "-r", dir.file("missing")});
  EXPECT_EQ(result.status, 255);
  EXPECT_THAT(result.err, HasSubstr("failed to open " + errorLog + " errno = 13"));
  EXPECT_EQ(ReadFile(target), "existing\n");

  unlink(errorLog.c_str());
  ASSERT_EQ(link(target.c_str(), errorLog.c_str()), 0);
  result = tarvod({"-c", config, "-r", dir.file("missing")});
  EXPECT_EQ(result.status, 0);
  EXPECT_EQ(ReadFile(target).rfind("existing\n", 0), 0u);
  EXPECT_THAT(ReadFile(target), HasSubstr("No rules found"));
}

// The rules directory is loaded as a directory though its name has an extension; leftovers of
// editors and package managers beside the rules are not loaded.
TEST_F(DaemonTest, RulesTreeLoadsEveryRulesFileAtAnyDepth) {
  dir.write("rules.d/one.plist", RulesDocument({RuleXml("one", {"a.b"})}));
  dir.write("rules.d/nested/deeper/two.plist", RulesDocument({RuleXml("two", {"a.b", "c"})}));
  dir.write("rules.d/.hidden/three.plist", RulesDocument({RuleXml("three", {"a.b"})}));
  dir.write("rules.d/.four.plist", RulesDocument({RuleXml("four", {"a.b"})}));
  dir.write("rules.d/notes.txt", "not a property list");
  dir.write("rules.d/one.plist.dpkg-old", RulesDocument({RuleXml("old", {"a.b"})}));
  dir.write("rules.d/dict.plist", PlistDocument(Dict({{"name", Str("x")}})));
  dir.write("rules.d/mixed.plist",
            RulesDocument(
                {RuleXml("disabled", {"a.b"}, {{"enabled", Bool(false)}}),
                 Dict({{"name", Str("stringTypes")}, {"eventTypes", Str("a.b")}}), Str("junk"),
                 RuleXml("twice", {"d", "d"}), RuleXml("none", {}),
                 Dict({{"name", Str("oddTypes")},
                       {"eventTypes", Arr({Int(5), Bool(true), Arr({Str("e")}), Str("e")})}})}));
  Daemon daemon({"-c", writeConfig({{"debugLevel", Int(3)}}), "-r", dir.file("rules.d")}, dir);
  ASSERT_TRUE(daemon.waitForLine(errorLog, "Registered"));
  EXPECT_EQ(daemon.stop(SIGINT), 0);
  const std::string log = ReadFile(errorLog);
  // one, two, three, four, twice, none and oddTypes; the disabled rule and the string-typed
  // one are not.
  EXPECT_THAT(log, HasSubstr("Loaded 7 rules\n"));
  // Only the string among oddTypes' types indexes it; each other entry is named and skipped.
  const std::string mixed = dir.file("rules.d/mixed.plist");
  EXPECT_THAT(log, HasSubstr(mixed + ": rule 6 \"oddTypes\": eventTypes[1]: must be a string, "
                                     "not an integer\n"));
  EXPECT_THAT(log, HasSubstr(mixed + ": rule 3: must be a dictionary, not a string; skipped\n"));
  EXPECT_THAT(log, HasSubstr(dir.file("rules.d/dict.plist") +
                             ": the top level is not an array of rules; skipped\n"));
  EXPECT_THAT(log, HasSubstr("5 files read, 7 rules loaded, 3 files skipped, 9 problems found\n"));
  EXPECT_EQ(log.find("  Added rule: oddTypes\n"), log.rfind("  Added rule: oddTypes\n"));
  EXPECT_NE(log.find("  Added rule: oddTypes\n"), std::string::npos);
  EXPECT_THAT(log, HasSubstr("  Skipping disabled rule: disabled\n"));
  EXPECT_THAT(log, Not(HasSubstr("Added rule: stringTypes")));
  EXPECT_THAT(log, Not(HasSubstr("Added rule: old")));
  EXPECT_THAT(log, Not(HasSubstr("LOADING RULES (" + dir.file("rules.d/notes.txt"))));
  EXPECT_THAT(log, HasSubstr("  Added rule: twice\n  Added rule: twice\n"));
  EXPECT_THAT(log, HasSubstr("  Added rule: two\n  Added rule: two\n"));
  EXPECT_THAT(log, HasSubstr("LOADING RULES (" + dir.file("rules.d/.hidden/three.plist") + ")"));
}

TEST_F(DaemonTest, AtLevelZeroTheRulesSummarySaysWhereToSeeTheProblems) {
  const std::string rules = dir.write(
      "bad.plist", RulesDocument({RuleXml("r", {"a"}, {{"critera", Arr({Criterion("true")})}})}));
  Daemon daemon({"-c", writeConfig(), "-r", rules}, dir);
  ASSERT_TRUE(daemon.waitForLine(errorLog, "problems found"));
  EXPECT_THAT(ReadFile(errorLog), HasSubstr("1 problems found (tarvodctl check lists them)\n"));
}

TEST_F(DaemonTest, SigusrOneIsIgnoredAndSigtermWithSighupStopsWithoutReloading) {
  Daemon daemon({"-c", writeConfig(), "-r", writeOneRule(), "-v", "1"}, dir);
  ASSERT_TRUE(daemon.waitForLine(errorLog, "Registered"));
  kill(daemon.pid(), SIGUSR1);
  usleep(200 * 1000);
  EXPECT_TRUE(daemon.running());
  // Stopped, the daemon takes both signals at once when it continues.
  kill(daemon.pid(), SIGSTOP);
  kill(daemon.pid(), SIGHUP);
  kill(daemon.pid(), SIGTERM);
  kill(daemon.pid(), SIGCONT);
  EXPECT_EQ(daemon.wait(), 0);
  EXPECT_THAT(ReadFile(errorLog), Not(HasSubstr("Reloading Rules")));
}

// logrotate moves the logs away and reloads: the error and event logs are written again by
// their names, and nothing more goes to the moved files.
TEST_F(DaemonTest, AReloadReopensRotatedLogs) {
  const std::string events = dir.file("events.log");
  const std::string config = writeConfig({{"logEvents", Int(1)}, {"eventLogPath", Str(events)}});
  Daemon daemon({"-c", config, "-r", writeOneRule(), "-v", "1"}, dir);
  ASSERT_TRUE(daemon.waitForLine(errorLog, "Registered"));
  ASSERT_TRUE(daemon.waitForLine(events, "startup.load"));
  ASSERT_EQ(std::rename(errorLog.c_str(), (errorLog + ".1").c_str()), 0);
  ASSERT_EQ(std::rename(events.c_str(), (events + ".1").c_str()), 0);
  kill(daemon.pid(), SIGHUP);
  EXPECT_TRUE(daemon.waitForLine(errorLog, "Reloading Rules"));
  EXPECT_TRUE(daemon.waitForLine(events, "startup.reload"));
  EXPECT_EQ(daemon.stop(), 0);
  EXPECT_THAT(ReadFile(errorLog + ".1"), Not(HasSubstr("Reloading Rules")));
  EXPECT_THAT(ReadFile(events + ".1"), Not(HasSubstr("startup.reload")));
  EXPECT_THAT(ReadFile(errorLog), HasSubstr("Velkin Shutdown at"));
}

// Interval timers on the real loop: a one-second timer fires every second, and after a reload
// there is still one timer (two would tick twice as fast).
TEST_F(DaemonTest, PeriodicEventsTickOnTheirIntervalAndAReloadRecreatesThem) {
  const std::string ticks = dir.file("ticks");
  const std::string config = writeConfig(
      {{"periodicEvents", Arr({Dict({{"eventType", Str("tick")}, {"startInterval", Int(1)}})})}});
  const std::string rules = dir.write(
      "rules.plist",
      RulesDocument({RuleXml("tick", {"tick"}, {{"actions", Arr({FileLog("t", ticks)})}})}));
  Daemon daemon({"-c", config, "-r", rules, "-v", "3"}, dir);
  ASSERT_TRUE(daemon.waitForLine(ticks, "t\nt\n", 5s));
  kill(daemon.pid(), SIGHUP);
  ASSERT_TRUE(daemon.waitForLine(errorLog, "EVENT RECEIVED: startup.reload"));
  const auto reloaded = std::chrono::steady_clock::now();
  const std::string after = ReadFile(ticks) + "t\nt\nt\n";
  ASSERT_TRUE(daemon.waitForLine(ticks, after, 10s));
  EXPECT_GE(std::chrono::steady_clock::now() - reloaded, 2400ms);
  EXPECT_EQ(daemon.stop(), 0);
  EXPECT_THAT(ReadFile(errorLog), HasSubstr("Periodic Event received: {"));
}

// File-local variables survive a restart; the shutdown rules run before the state is saved
// and "Velkin Shutdown at" is the last line.
TEST_F(DaemonTest, StateIsSavedAtShutdownAndRestoredAtTheNextStart) {
  const std::string config =
      writeConfig({{"saveState", Bool(true)}, {"stateDirectory", Str(dir.file("state"))}});
  const std::string rules = dir.write(
      "rules.plist",
      RulesDocument(
          {RuleXml("count", {"startup.load"}, {{"variables", Dict({{"n", Str("${n} + 1")}})}}),
           RuleXml("bye", {"shutdown"}, {{"variables", Dict({{"bye", Str("yes")}})}})}));
  for (int run = 1; run <= 2; ++run) {
    std::remove(errorLog.c_str());
    Daemon daemon({"-c", config, "-r", rules, "-v", "1"}, dir);
    ASSERT_TRUE(daemon.waitForLine(errorLog, "Registered"));
    EXPECT_EQ(daemon.stop(), 0);
    const std::string state = ReadFile(dir.file("state/state"));
    EXPECT_THAT(state, HasSubstr("<key>n</key>\n\t\t<integer>" + std::to_string(run)));
    EXPECT_THAT(state, HasSubstr("<key>bye</key>"));
  }
  const std::string log = ReadFile(errorLog);
  EXPECT_LT(log.rfind("Saving the global state...\n"), log.rfind("Velkin Shutdown at "));
  EXPECT_EQ(log.find('\n', log.rfind("Velkin Shutdown at ")), log.size() - 1);
}

TEST_F(DaemonTest, TellsTheServiceManagerWhenReadyReloadingAndStopping) {
  const std::string socketPath = dir.file("notify");
  const int listener = BindUnixDatagram(socketPath);
  ASSERT_GE(listener, 0);
  const auto next = [&] {
    pollfd ready{listener, POLLIN, 0};
    if (poll(&ready, 1, 10000) != 1) return std::string("(nothing)");
    char buffer[256];
    const ssize_t n = recv(listener, buffer, sizeof buffer, 0);
    return std::string(buffer, n > 0 ? static_cast<size_t>(n) : 0);
  };
  setenv("NOTIFY_SOCKET", socketPath.c_str(), 1);
  Daemon daemon({"-c", writeConfig(), "-r", writeOneRule()}, dir);
  unsetenv("NOTIFY_SOCKET");
  EXPECT_EQ(next(), "READY=1");
  kill(daemon.pid(), SIGHUP);
  EXPECT_EQ(next(), "RELOADING=1");
  EXPECT_EQ(next(), "READY=1");
  kill(daemon.pid(), SIGTERM);
  EXPECT_EQ(next(), "STOPPING=1");
  EXPECT_EQ(daemon.wait(), 0);
  close(listener);
}

// The fixed log directory is checked only inside a private mount namespace with a tmpfs over
// /var/log, so the machine's own logs are never touched.
TEST_F(DaemonTest, TheVelkinLogDirectoryIsCreatedAndNothingElseTakenForIt) {
  const std::string config =
      dir.write("velkin.plist", ConfigPlist({{"errorLogPath", Str("/var/log/velkin/tarvod.log")}}));
  const struct {
    std::string setup;
    std::string out;  // what the shell prints: tarvod's status, then the directory's modes
    std::string err;
  } cases[] = {
      {"true", "status=0\n755 directory\n600\n", ""},
      {"touch /var/log/velkin", "status=255", "/var/log/velkin is not a directory"},
      {"mkdir /var/log/real; ln -s /var/log/real /var/log/velkin", "status=255",
       "/var/log/velkin is not a directory"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.setup);
    const std::string script = "mount -t tmpfs tmpfs /var/log || exit 99; umask 022; " + c.setup +
                               "; '" + TarvodBinary() + "' -c '" + config + "' -r '" +
                               dir.file("missing") +
                               "'; echo status=$?; stat -c '%a %F' /var/log/velkin; "
                               "stat -c '%a' /var/log/velkin/tarvod.log";
    const RunResult r =
        RunProgram({"/usr/bin/unshare", "-m", "--propagation", "private", "/bin/sh", "-c", script});
    if (r.status == 99 || r.status == 127) GTEST_SKIP() << "no mount namespace here: " << r.err;
    EXPECT_THAT(r.out, HasSubstr(c.out));
    EXPECT_THAT(r.err, HasSubstr(c.err));
  }
}

}  // namespace
}  // namespace tarvod::testing
