// The run-command action in the real daemon, as root, against users and groups made for the
// test: what the program sees in /proc, failures, time limits, and what many commands leave.
#include <gmock/gmock.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "harness.h"
#include "rules_xml.h"

namespace tarvod::testing {
namespace {

using ::testing::HasSubstr;

// The user's or group's ID as text; empty when there is none.
std::string UserId(const std::string& name) {
  const passwd* entry = getpwnam(name.c_str());
  return entry ? std::to_string(entry->pw_uid) : "";
}
std::string GroupId(const std::string& name) {
  const group* entry = getgrnam(name.c_str());
  return entry ? std::to_string(entry->gr_gid) : "";
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
  const std::filesystem::directory_iterator fds("/proc/" + std::to_string(pid) + "/fd");
  return static_cast<size_t>(std::distance(begin(fds), end(fds)));
}

// The state letter and the parent of a process; "" when it is gone.
std::pair<std::string, pid_t> StateAndParent(const std::string& pid) {
  const std::string stat = ReadFile("/proc/" + pid + "/stat");
  std::pair<std::string, pid_t> fields{"", 0};
  const size_t close = stat.rfind(')');
  if (close != std::string::npos)
    std::istringstream(stat.substr(close + 2)) >> fields.first >> fields.second;
  return fields;
}

// Processes whose parent is pid.
std::vector<std::string> ChildrenOf(pid_t pid) {
  std::vector<std::string> children;
  for (const auto& entry : std::filesystem::directory_iterator("/proc")) {
    const std::string name = entry.path().filename();
    if (StateAndParent(name).second == pid) children.push_back(name);
  }
  return children;
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

class RunCommandTest : public TarvodTest {
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
    ASSERT_FALSE(UserId(sUser).empty()) << "useradd failed";
    // The programs write here as other users.
    chmod(dir.path().c_str(), 0777);
  }

  static inline std::string sUser, sGroup, sExtraGroup;
};

TEST_F(RunCommandTest, RunsAsTheChosenIdentityWithOnlyItsStreamsAndEnvironment) {
  const std::string statusArgs = "/proc/self/status";
  dir.write("say", "#!/bin/sh\necho ran \"$@\"\n");
  chmod(dir.file("say").c_str(), 0755);
  runActions(
      {
          Command("/bin/cat", {statusArgs}, {{"stdoutPath", Str(dir.file("default.txt"))}}),
          Command("/bin/cat", {statusArgs},
                  {{"stdoutPath", Str(dir.file("user.txt"))},
                   {"user", Str(sUser)},
                   {"group", Str(sGroup)}}),
          Command("/bin/ls", {"-l", "/proc/self/fd"}, {{"stdoutPath", Str(dir.file("fds.txt"))}}),
          Command(
              "/usr/bin/env", {},
              {{"stdoutPath", Str(dir.file("env.txt"))},
               {"environment", Dict({{"ZED", Str("1")}, {"TYPE", Str("${event:eventType}")}})}}),
          Command("say", {"relative"},
                  {{"workingDirectory", Str(dir.path())},
                   {"stdoutPath", Str(dir.file("relative.txt"))}}),
      },
      3);

  const std::string defaults = ReadFile(dir.file("default.txt"));
  EXPECT_EQ(StatusValues(defaults, "Uid"), std::set<std::string>{"99"});
  EXPECT_EQ(StatusValues(defaults, "Gid"), std::set<std::string>{"99"});
  EXPECT_EQ(StatusValues(defaults, "Groups"), std::set<std::string>{"99"});

  const std::string user = ReadFile(dir.file("user.txt"));
  EXPECT_EQ(StatusValues(user, "Uid"), std::set<std::string>{UserId(sUser)});
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
  EXPECT_EQ(ReadFile(dir.file("relative.txt")), "ran relative\n");
}

// What fails in the child ends it with its status: the program never runs, or never starts.
TEST_F(RunCommandTest, FailuresInTheChildEndItWithTheirStatus) {
  const std::string touched = dir.file("touched");
  dir.write("append.txt", std::string(100, 'o'));
  chmod(dir.file("append.txt").c_str(), 0666);
  const std::string log = runActions(
      {
          Command("/usr/bin/touch", {touched}, {{"stdinPath", Str(dir.file("missing"))}}),
          Command("/usr/bin/touch", {touched}, {{"workingDirectory", Str(dir.file("nowhere"))}}),
          Command(dir.file("no-program"), {}),
          Command("/bin/echo", {"new"}, {{"stdoutPath", Str(dir.file("append.txt"))}}),
          Command("/bin/echo", {"again"}, {{"stdoutPath", Str(dir.file("append.txt"))}}),
      },
      3);
  EXPECT_FALSE(FileExists(touched));
  // The main thread may write its own lines between the child's and the queue's.
  EXPECT_THAT(log, HasSubstr("DoRunAction (child): Redirect of stdin to " + dir.file("missing") +
                             " failed errno = 2\n"));
  EXPECT_THAT(log, HasSubstr("DoRunAction: /usr/bin/touch exited with status 1\n"));
  EXPECT_THAT(log, HasSubstr("DoRunAction (child): chdir to " + dir.file("nowhere") + " failed\n"));
  EXPECT_THAT(log, HasSubstr("DoRunAction: /usr/bin/touch exited with status 2\n"));
  EXPECT_THAT(log, HasSubstr("DoRunAction: " + dir.file("no-program") + " exited with status 2"));
  // Earlier content stays; each run's output follows whole.
  EXPECT_EQ(ReadFile(dir.file("append.txt")), std::string(100, 'o') + "new\nagain\n");
}

TEST_F(RunCommandTest, AFailedIdentityChangeEndsTheChildBeforeTheProgram) {
  // Root of a user namespace that maps nothing but itself: no change of identity can succeed.
  const std::string touched = dir.file("touched");
  const std::string log = runActions({Command("/usr/bin/touch", {touched})}, 3, {},
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
  const std::string log = runActions({Command("/bin/sleep", {"100"}, {{"timeout", Str("0.5")}}),
                                      Command("/bin/sh", {"-c", script})},
                                     3, {{"commandTimeout", Int(1)}});
  const auto elapsed = std::chrono::steady_clock::now() - before;
  EXPECT_LT(elapsed, 20s);
  EXPECT_THAT(log,
              HasSubstr("DoRunAction: /bin/sleep still running after 0.5 seconds; ending its"
                        " process group (SIGTERM, SIGKILL 2 seconds later) (rule \"actions\" in "));
  EXPECT_THAT(log, HasSubstr("DoRunAction: /bin/sleep exited with status 143\n"));
  EXPECT_THAT(log, HasSubstr("DoRunAction: /bin/sh still running after 1 seconds"));
  EXPECT_THAT(log, HasSubstr("DoRunAction: /bin/sh exited with status 137\n"));
  for (const char* file : {"sh.pid", "sleep.pid"}) {
    std::string pid = ReadFile(dir.file(file));
    while (!pid.empty() && pid.back() == '\n') pid.pop_back();
    ASSERT_FALSE(pid.empty()) << file;
    // Gone, or a zombie left to whoever inherited it.
    const std::string state = StateAndParent(pid).first;
    EXPECT_TRUE(state.empty() || state == "Z") << file;
  }
}

TEST_F(RunCommandTest, AThousandCommandsLeaveNoZombieAndNoDescriptorBehind) {
  std::vector<std::string> actions(1000, Command("/bin/true", {}));
  actions.push_back(FileLog("done", out));
  Daemon& running = start({RuleXml("batch", {"batch"}, {{"actions", Arr(actions)}})}, 3);
  // One connection first: the loop's timer descriptor is made at the first connection's idle
  // timer and kept.
  Tarvodctl({"send", "--socket", socket, "warm.up"});
  usleep(200000);
  const size_t descriptors = CountDescriptors(running.pid());
  const RunResult sent = Tarvodctl({"send", "--socket", socket, "batch"});
  ASSERT_EQ(sent.status, 0) << sent.err;
  ASSERT_TRUE(running.waitForLine(out, "done", 120s)) << ReadFile(errorLog).substr(0, 2000);
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
