// The run-command action in the real daemon, run as root against real users and groups made
// for the test: identities and descriptors as the program sees them in /proc, arguments,
// environment, redirections, the failures before and after the start, time limits, and the
// daemon's own descriptors and children after many commands.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "harness.h"
#include "rules_xml.h"

namespace tarvod::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

std::string Id(const char* kind, const std::string& name) {
  std::string text = RunProgram({"/usr/bin/id", kind, name}).out;
  while (!text.empty() && text.back() == '\n') text.pop_back();
  return text;
}

std::string GroupId(const std::string& name) {
  std::string line = RunProgram({"/usr/bin/getent", "group", name}).out;
  // name:x:gid:members
  const size_t first = line.find(':');
  const size_t second = line.find(':', first + 1);
  const size_t third = line.find(':', second + 1);
  return line.substr(second + 1, third - second - 1);
}

// The values of a "Name:\tv1\tv2" line of /proc/PID/status text.
std::set<std::string> StatusValues(const std::string& status, const std::string& name) {
  std::set<std::string> values;
  const size_t at = status.find(name + ":");
  if (at == std::string::npos) return values;
  std::istringstream line(
      status.substr(at + name.size() + 1, status.find('\n', at) - at - name.size() - 1));
  for (std::string value; line >> value;) values.insert(value);
  return values;
}

size_t CountDescriptors(pid_t pid) {
  size_t count = 0;
  for ([[maybe_unused]] const auto& entry :
       std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/fd")) {
    ++count;
  }
  return count;
}

// Processes whose parent is pid.
std::vector<std::string> ChildrenOf(pid_t pid) {
  std::vector<std::string> children;
  for (const auto& entry : std::filesystem::directory_iterator("/proc")) {
    const std::string stat = ReadFile(entry.path().string() + "/stat");
    const size_t close = stat.rfind(')');
    if (close == std::string::npos) continue;
    std::istringstream fields(stat.substr(close + 2));
    std::string state;
    pid_t parent = 0;
    fields >> state >> parent;
    if (parent == pid) children.push_back(stat);
  }
  return children;
}

// Gone, or a zombie left to whoever inherited it.
bool Ended(const std::string& pidText) {
  const std::string stat = ReadFile("/proc/" + pidText + "/stat");
  const size_t close = stat.rfind(')');
  return stat.empty() || (close != std::string::npos && stat.compare(close + 2, 1, "Z") == 0);
}

std::string Command(const std::string& program, const std::vector<std::string>& arguments,
                    std::vector<std::pair<std::string, std::string>> more = {}) {
  std::vector<std::string> argumentXml;
  for (const auto& argument : arguments) argumentXml.push_back(Str(argument));
  more.insert(
      more.begin(),
      {{"type", Str("runcommand")}, {"command", Str(program)}, {"arguments", Arr(argumentXml)}});
  return Dict(more);
}

class RunCommandTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    if (geteuid() != 0) return;
    const std::string id = std::to_string(getpid());
    sUser = "tarvodt-" + id;
    sGroup = "tarvodt-" + id + "-g";
    sExtraGroup = "tarvodt-" + id + "-s";
    RunProgram({"/usr/sbin/groupadd", sGroup});
    RunProgram({"/usr/sbin/groupadd", sExtraGroup});
    RunProgram(
        {"/usr/sbin/useradd", "-M", "-U", "-G", sExtraGroup, "-s", "/usr/sbin/nologin", sUser});
  }
  static void TearDownTestSuite() {
    if (sUser.empty()) return;
    RunProgram({"/usr/sbin/userdel", sUser});
    for (const auto& group : {sUser, sGroup, sExtraGroup}) {
      RunProgram({"/usr/sbin/groupdel", group});
    }
  }

  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to change identities";
    ASSERT_FALSE(Id("-u", sUser).empty()) << "useradd failed";
    // The programs write here as other users.
    chmod(dir.path().c_str(), 0777);
  }

  // Starts the daemon on the rules (at debug level 3) and waits for the startup event.
  Daemon& start(const std::vector<std::string>& rules,
                const std::vector<std::pair<std::string, std::string>>& config = {},
                const std::vector<std::string>& launcher = {}) {
    auto entries = config;
    entries.push_back({"errorLogPath", Str(errorLog)});
    entries.push_back({"eventSocketPath", Str(socket)});
    entries.push_back({"stateDirectory", Str(dir.path())});
    const std::string configPath = dir.write("tarvod.plist", ConfigPlist(entries));
    dir.write("rules.plist", RulesDocument(rules));
    daemon = std::make_unique<Daemon>(
        std::vector<std::string>{"-c", configPath, "-r", dir.file("rules.plist"), "-v", "3", "-n"},
        dir, launcher);
    EXPECT_TRUE(daemon->waitForLine(errorLog, "EVENT RECEIVED: startup.load"))
        << daemon->stderrText();
    return *daemon;
  }
  // Runs the daemon until the startup rules have written "done" to the marker file.
  std::string runToEnd(std::vector<std::string> actions,
                       const std::vector<std::pair<std::string, std::string>>& config = {},
                       const std::vector<std::string>& launcher = {}) {
    actions.push_back(FileLog("done", marker));
    start({RuleXml("commands", {"startup.load"}, {{"actions", Arr(actions)}})}, config, launcher);
    EXPECT_TRUE(daemon->waitForLine(marker, "done", 60s)) << ReadFile(errorLog);
    EXPECT_EQ(daemon->stop(), 0);
    return ReadFile(errorLog);
  }

  static inline std::string sUser, sGroup, sExtraGroup;
  TempDir dir;
  const std::string errorLog = dir.file("error.log");
  const std::string socket = dir.file("evtq");
  const std::string marker = dir.file("marker");
  std::unique_ptr<Daemon> daemon;
};

TEST_F(RunCommandTest, RunsAsTheChosenIdentityWithOnlyItsStreamsArgumentsAndEnvironment) {
  const std::string statusArgs = "/proc/self/status";
  dir.write("say\\:it", "#!/bin/sh\necho ran \"$@\"\n");
  chmod(dir.file("say\\:it").c_str(), 0755);
  const std::string log = runToEnd({
      Command("/bin/cat", {statusArgs}, {{"stdoutPath", Str(dir.file("default.txt"))}}),
      Command("/bin/cat", {statusArgs},
              {{"stdoutPath", Str(dir.file("user.txt"))},
               {"user", Str(sUser)},
               {"group", Str(sGroup)}}),
      Command("/bin/ls", {"-l", "/proc/self/fd"}, {{"stdoutPath", Str(dir.file("fds.txt"))}}),
      Command("/usr/bin/env", {},
              {{"stdoutPath", Str(dir.file("env.txt"))},
               {"environment", Dict({{"ZED", Str("1")}, {"TYPE", Str("${event:eventType}")}})}}),
      Dict({{"type", Str("runcommand")},
            {"command", Str("usr/bin/printf")},
            {"arguments", Arr({Str("[%s]"), Arr({Str("a"), Str("b")}), Str("x\\:y"), Int(7)})},
            {"stdoutPath", Str(dir.file("args.txt"))}}),
      Command(dir.file("say\\:it"), {"c\\:d"}, {{"stdoutPath", Str(dir.file("colon.txt"))}}),
      Command(
          "say\\:it", {"relative"},
          {{"workingDirectory", Str(dir.path())}, {"stdoutPath", Str(dir.file("relative.txt"))}}),
  });

  const std::string defaults = ReadFile(dir.file("default.txt"));
  EXPECT_EQ(StatusValues(defaults, "Uid"), std::set<std::string>{"99"});
  EXPECT_EQ(StatusValues(defaults, "Gid"), std::set<std::string>{"99"});
  EXPECT_EQ(StatusValues(defaults, "Groups"), std::set<std::string>{"99"});

  const std::string user = ReadFile(dir.file("user.txt"));
  EXPECT_EQ(StatusValues(user, "Uid"), std::set<std::string>{Id("-u", sUser)});
  EXPECT_EQ(StatusValues(user, "Gid"), std::set<std::string>{GroupId(sGroup)});
  // The chosen group and the user's supplementary groups; not its primary group.
  EXPECT_EQ(StatusValues(user, "Groups"),
            (std::set<std::string>{GroupId(sGroup), GroupId(sExtraGroup)}));

  // ls lists its own descriptors: the three streams and the directory it reads.
  std::istringstream fds(ReadFile(dir.file("fds.txt")));
  int listed = 0;
  for (std::string line; std::getline(fds, line);) {
    const size_t arrow = line.find(" -> ");
    if (arrow == std::string::npos) continue;
    const std::string head = line.substr(0, arrow);
    const std::string number = head.substr(head.rfind(' ') + 1);
    const std::string target = line.substr(arrow + 4);
    ++listed;
    if (number == "0" || number == "1" || number == "2") {
      EXPECT_EQ(target, number == "1" ? dir.file("fds.txt") : "/dev/null");
    } else {
      EXPECT_THAT(target, ::testing::MatchesRegex("/proc/[0-9]+/fd")) << line;
    }
  }
  EXPECT_EQ(listed, 4);

  EXPECT_EQ(ReadFile(dir.file("env.txt")), "ZED=1\nTYPE=startup.load\n");
  EXPECT_EQ(ReadFile(dir.file("args.txt")), "[a,b][x:y][7]");
  EXPECT_EQ(ReadFile(dir.file("colon.txt")), "ran c:d\n");
  EXPECT_EQ(ReadFile(dir.file("relative.txt")), "ran relative\n");
  EXPECT_THAT(log,
              HasSubstr("    Executing command:\n      usr/bin/printf \"[%s]\" \"(\n    a,\n    "
                        "b\n)\" \"x:y\" \"7\"\n"));
}

TEST_F(RunCommandTest, FailuresBeforeAndAfterTheStartEndTheChildWithTheirStatus) {
  const std::string touched = dir.file("touched");
  dir.write("append.txt", std::string(100, 'o'));
  chmod(dir.file("append.txt").c_str(), 0666);
  const std::string log = runToEnd({
      Command("/usr/bin/touch", {touched}, {{"stdinPath", Str(dir.file("missing"))}}),
      Command("/usr/bin/touch", {touched}, {{"user", Str(sUser + "-none")}}),
      Command("/usr/bin/touch", {touched}, {{"group", Str(sGroup + "-none")}}),
      Command("/usr/bin/touch", {touched}, {{"workingDirectory", Str(dir.file("nowhere"))}}),
      Command(dir.file("no-program"), {}),
      Command("/bin/echo", {"new"}, {{"stdoutPath", Str(dir.file("append.txt"))}}),
      Command("/bin/echo", {"again"}, {{"stdoutPath", Str(dir.file("append.txt"))}}),
  });
  EXPECT_FALSE(FileExists(touched));
  // The main thread may write its own lines between the child's and the queue's.
  EXPECT_THAT(log, HasSubstr("DoRunAction (child): Redirect of stdin to " + dir.file("missing") +
                             " failed errno = 2\n"));
  EXPECT_THAT(log, HasSubstr("DoRunAction: /usr/bin/touch exited with status 1\n"));
  EXPECT_THAT(log, HasSubstr("DoRunAction: User '" + sUser + "-none' not found. Aborting action"));
  EXPECT_THAT(log,
              HasSubstr("DoRunAction: Group '" + sGroup + "-none' not found. Aborting action"));
  EXPECT_THAT(log, HasSubstr("DoRunAction (child): chdir to " + dir.file("nowhere") + " failed\n"));
  EXPECT_THAT(log, HasSubstr("DoRunAction: /usr/bin/touch exited with status 2\n"));
  EXPECT_THAT(log, HasSubstr("DoRunAction: " + dir.file("no-program") + " exited with status 2"));
  // Earlier content stays; each run's output follows whole.
  EXPECT_EQ(ReadFile(dir.file("append.txt")), std::string(100, 'o') + "new\nagain\n");
}

TEST_F(RunCommandTest, AFailedIdentityChangeEndsTheChildBeforeTheProgram) {
  // Root of a user namespace that maps nothing but itself: no change of identity can succeed.
  const std::string touched = dir.file("touched");
  const std::string log = runToEnd({Command("/usr/bin/touch", {touched})}, {},
                                   {"/usr/bin/unshare", "--user", "--map-root-user"});
  EXPECT_FALSE(FileExists(touched));
  EXPECT_THAT(log, HasSubstr("DoRunAction (child): Change to user ID 99, group ID 99 failed "
                             "errno = 1\n"));
  EXPECT_THAT(log, HasSubstr("DoRunAction: /usr/bin/touch exited with status 1\n"));
}

TEST_F(RunCommandTest, ATimeLimitEndsTheProgramAndEverythingItStarted) {
  // The shell and its sleep ignore SIGTERM: SIGKILL ends them. The sleep alone ends at once.
  const std::string script = "trap '' TERM; echo $$ > " + dir.file("sh.pid") +
                             "; /bin/sleep 100 & echo $! > " + dir.file("sleep.pid") + "; wait";
  const auto before = std::chrono::steady_clock::now();
  const std::string log = runToEnd({Command("/bin/sleep", {"100"}, {{"timeout", Str("0.5")}}),
                                    Command("/bin/sh", {"-c", script})},
                                   {{"commandTimeout", Int(1)}});
  const auto elapsed = std::chrono::steady_clock::now() - before;
  EXPECT_LT(elapsed, 20s);
  EXPECT_THAT(
      log, HasSubstr("DoRunAction: /bin/sleep still running after 0.5 seconds; ending its"
                     " process group (SIGTERM, SIGKILL 2 seconds later) (rule \"commands\" in "));
  EXPECT_THAT(log, HasSubstr("DoRunAction: /bin/sleep exited with status 143\n"));
  EXPECT_THAT(log, HasSubstr("DoRunAction: /bin/sh still running after 1 seconds"));
  EXPECT_THAT(log, HasSubstr("DoRunAction: /bin/sh exited with status 137\n"));
  for (const char* file : {"sh.pid", "sleep.pid"}) {
    std::string pid = ReadFile(dir.file(file));
    while (!pid.empty() && pid.back() == '\n') pid.pop_back();
    ASSERT_FALSE(pid.empty()) << file;
    EXPECT_TRUE(Ended(pid)) << file;
  }
}

TEST_F(RunCommandTest, AThousandCommandsLeaveNoZombieAndNoDescriptorBehind) {
  std::vector<std::string> actions(1000, Command("/bin/true", {}));
  actions.push_back(FileLog("done", marker));
  Daemon& running = start({RuleXml("batch", {"batch"}, {{"actions", Arr(actions)}})});
  usleep(200000);  // the listener comes up just after the startup event
  // One connection first: the loop's timer descriptor is made at the first connection's idle
  // timer and kept.
  RunProgram({TarvodctlBinary(), "send", "--socket", socket, "warm.up"});
  usleep(200000);
  const size_t descriptors = CountDescriptors(running.pid());
  RunResult sent;
  for (int attempt = 0; attempt < 50; ++attempt) {
    sent = RunProgram({TarvodctlBinary(), "send", "--socket", socket, "batch"});
    if (sent.status == 0) break;
    usleep(100000);
  }
  ASSERT_EQ(sent.status, 0) << sent.err;
  ASSERT_TRUE(running.waitForLine(marker, "done", 120s)) << ReadFile(errorLog).substr(0, 2000);
  EXPECT_EQ(CountDescriptors(running.pid()), descriptors);
  EXPECT_THAT(ChildrenOf(running.pid()), ::testing::IsEmpty());
  EXPECT_EQ(running.stop(), 0);
  const std::string log = ReadFile(errorLog);
  size_t exits = 0;
  for (size_t at = log.find("/bin/true exited with status 0\n"); at != std::string::npos;
       at = log.find("/bin/true exited with status 0\n", at + 1)) {
    ++exits;
  }
  EXPECT_EQ(exits, 1000u);
}

}  // namespace
}  // namespace tarvod::testing
