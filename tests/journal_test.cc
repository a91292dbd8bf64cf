// The structured log through a real systemd-journald of the test's own, in a private mount
// namespace the daemon inherits; records are read back with journalctl. Root only.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "harness.h"
#include "platform/testing/log_capture.h"
#include "rules_xml.h"

namespace tarvod::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

constexpr const char* kJournald = "/lib/systemd/systemd-journald";
constexpr const char* kSocket = "/run/systemd/journal/socket";
constexpr const char* kNowhereToGo =
    "Event records have nowhere to go: no journal socket (journald is not running) and no "
    "structuredLogPath; start systemd-journald or set structuredLogPath to a file";

// Empty journal directories, visible to this process and its children only.
bool EnterPrivateJournalNamespace(std::string& why) {
  static const std::string failure = []() -> std::string {
    if (geteuid() != 0) return "needs root";
    if (access(kJournald, X_OK) != 0) return "no systemd-journald";
    if (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr)) {
      return "no private mount namespace";
    }
    std::error_code ignored;
    std::filesystem::create_directories("/run/systemd/journal", ignored);
    std::filesystem::create_directories("/run/log/journal", ignored);
    for (const char* dir : {"/run/systemd/journal", "/run/log/journal", "/var/log/journal"}) {
      if (FileExists(dir) && mount("tmpfs", dir, "tmpfs", 0, "mode=0755") != 0) {
        return std::string("cannot mount tmpfs on ") + dir;
      }
    }
    return "";
  }();
  why = failure;
  return failure.empty();
}

class Journald {
 public:
  Journald() {
    mPid = fork();
    if (mPid == 0) {
      const int null = open("/dev/null", O_RDWR);
      dup2(null, 1);
      dup2(null, 2);
      execl(kJournald, kJournald, static_cast<char*>(nullptr));
      _exit(127);
    }
    for (int i = 0; i < 100 && access(kSocket, F_OK) != 0; ++i) usleep(50000);
  }
  ~Journald() {
    if (mPid > 0) {
      kill(mPid, SIGTERM);
      waitpid(mPid, nullptr, 0);
    }
    unlink(kSocket);  // the next test starts without a journal unless it starts one
  }
  Journald(const Journald&) = delete;
  Journald& operator=(const Journald&) = delete;
  bool ready() const { return mPid > 0 && access(kSocket, F_OK) == 0; }

 private:
  pid_t mPid = -1;
};

// One line per tarvod record: its own fields (not the journal's "_" ones) as KEY=value,
// sorted, separated by tabs.
std::vector<std::string> TarvodRecords() {
  const RunResult shown = RunProgram(
      {"/bin/sh", "-c",
       "journalctl --no-pager -o json SYSLOG_IDENTIFIER=tarvod | python3 -c '"
       "import json,sys\n"
       "for l in sys.stdin:\n"
       " r = json.loads(l)\n"
       " print(\"\\t\".join(k + \"=\" + str(v) for k, v in sorted(r.items()) if k[0] != \"_\"))'"});
  std::vector<std::string> lines;
  size_t start = 0;
  for (size_t end; (end = shown.out.find('\n', start)) != std::string::npos; start = end + 1) {
    lines.push_back("\t" + shown.out.substr(start, end - start) + "\t");
  }
  return lines;
}

class JournalTest : public TarvodTest {
 protected:
  void SetUp() override {
    std::string why;
    if (!EnterPrivateJournalNamespace(why)) GTEST_SKIP() << why;
  }
  // Records go to the journal: no structuredLogPath.
  const ConfigEntries toJournal = {{"structuredLogPath", ""}};
};

TEST_F(JournalTest, EventRecordsAndKvlogMessagesReachTheJournalWithTheirAttributes) {
  Journald journald;
  ASSERT_TRUE(journald.ready());
  const std::string message = "kv %s%n \"q\" 100%";
  const std::string log = run(
      {RuleXml("to journal", {"startup.load"},
               {{"actions", Arr({Dict({{"type", Str("log")},
                                       {"logType", Str("kvlog")},
                                       {"logLevel", Str("warning")},
                                       {"facility", Str("auth")},
                                       {"message", Str(message)},
                                       {"details", Dict({{"user", Str("root")},
                                                         {"message", Str("detail text")}})}})})}})},
      1, toJournal);
  EXPECT_THAT(log, Not(HasSubstr("Failed to log event")));
  EXPECT_THAT(log, Not(HasSubstr(kNowhereToGo)));

  std::vector<std::string> journal;
  for (int i = 0; i < 50; ++i) {  // journald stores what it received a moment later
    journal = TarvodRecords();
    if (journal.size() >= 3) break;
    usleep(100000);
  }
  std::string event, kv, shutdown;
  for (const auto& r : journal) {
    if (r.find("\tEVENTTYPE=startup.load\t") != std::string::npos) event = r;
    if (r.find("\tEVENTTYPE=shutdown\t") != std::string::npos) shutdown = r;
    if (r.find("\tFACILITY=auth\t") != std::string::npos) kv = r;
  }
  for (const char* field :
       {"\tPRIORITY=1\t", "\tEVENTSOURCE=tarvod\t", "\tHASRULES=true\t", "\tEVENTBLOCKED=false\t",
        "\tLEVEL=Alert\t", "\tSYSLOG_IDENTIFIER=tarvod\t", "\tTIME=", "\tTIMENANOSEC="}) {
    EXPECT_THAT(event, HasSubstr(field));
  }
  EXPECT_THAT(shutdown, HasSubstr("\tHASRULES=false\t"));
  EXPECT_THAT(kv, HasSubstr("\tPRIORITY=4\t"));  // "warning"
  EXPECT_THAT(kv, HasSubstr("\tMESSAGE=" + message + "\t"));
  EXPECT_THAT(kv, HasSubstr("\tUSER=root\t"));
  EXPECT_THAT(kv, HasSubstr("\tAMESSAGE=detail text\t"));  // never the record's own MESSAGE
}

// A journal socket nobody reads blocks the rule job for good: the daemon must still stop within
// shutdownTimeout, report what it dropped and save its state.
TEST_F(JournalTest, AStopEndsInTimeWhileARuleIsStuck) {
  unlink(kSocket);
  const int stuck = BindUnixDatagram(kSocket);
  ASSERT_GE(stuck, 0);
  // Every type has rules, so every record is written by a rule job, never by a sender.
  Daemon& daemon = start({RuleXml("count", {"tick", "shutdown", "startup"},
                                  {{"variables", Dict({{"n", Str("${n} + 1")}})}})},
                         1,
                         {{"structuredLogPath", ""},
                          {"saveState", Bool(true)},
                          {"stateDirectory", Str(dir.file("state"))},
                          {"shutdownTimeout", Int(1)}});
  for (int i = 0; i < 300; ++i) {
    Tarvodctl({"send", "--socket", socket, "tick"});
    if (ReadFile(errorLog).find("EVENT RECEIVED: tick") != std::string::npos && i > 50) break;
  }
  const auto begin = std::chrono::steady_clock::now();
  EXPECT_EQ(daemon.stop(SIGTERM, 10s), 0);
  EXPECT_LT(std::chrono::steady_clock::now() - begin, 2500ms);
  const std::string log = ReadFile(errorLog);
  EXPECT_THAT(log, HasSubstr("rule jobs still pending after 1 seconds"));
  EXPECT_EQ(log.find('\n', log.rfind("Velkin Shutdown at ")), log.size() - 1);
  EXPECT_THAT(ReadFile(dir.file("state/state")), HasSubstr("<key>n</key>"));
  close(stuck);
  unlink(kSocket);
}

// Writes one journal entry as a process whose command name is comm, running as uid, and
// stays alive until journald has read its name.
void SendAs(const char* comm, uid_t uid, const std::string& message,
            const char* identifier = "sshd") {
  const pid_t child = fork();
  if (child == 0) {
    prctl(PR_SET_NAME, comm);
    if (uid != 0 && setuid(uid) != 0) _exit(1);
    sd_journal_send("MESSAGE=%s", message.c_str(), "SYSLOG_IDENTIFIER=%s", identifier, nullptr);
    usleep(300'000);
    _exit(0);
  }
  waitpid(child, nullptr, 0);
}

TEST_F(JournalTest, RootSshdLinesBecomeLoginEventsAndForgedOnesNothing) {
  Journald journald;
  ASSERT_TRUE(journald.ready());
  const auto startDaemon = [&] {
    start({RuleXml("ssh", {"auth"},
                   {{"actions", Arr({FileLog("${event:eventType}|${event:clientIP}|"
                                             "${event:username}|${event:eventSource}",
                                             out)})}})},
          1, {{"stateDirectory", Str(dir.file("state"))}});
  };
  SendAs("sshd", 0, "Server listening on 0.0.0.0 port 22.");  // before the daemon: not replayed
  SendAs("sshd", 0, "Accepted password for early from 192.0.2.1 port 1 ssh2");
  startDaemon();
  SendAs("sshd", 0, "Accepted publickey for alice from 192.0.2.7 port 51234 ssh2: ED25519 x");
  SendAs("sshd-session", 0, "Failed password for invalid user bob from 2001:db8::1 port 2 ssh2");
  SendAs("sshd", 0, "Invalid user x from 10.0.0.1 port 1 from 192.0.2.8 port 3");
  // Forgeries: the right text from a user's process, or under sshd's identifier only.
  SendAs("sshd", 65534, "Failed password for root from 198.51.100.1 port 4 ssh2");
  SendAs("logger", 0, "Failed password for root from 198.51.100.2 port 5 ssh2");
  SendAs("sshd", 0, "Connection closed by invalid user last 192.0.2.9 port 6 [preauth]");
  ASSERT_TRUE(started->waitForLine(out, "|last|"));
  EXPECT_EQ(started->stop(), 0);
  EXPECT_EQ(ReadFile(out),
            "auth.success|192.0.2.7|alice|Journal\n"
            "auth.failure|2001:db8::1|bob|Journal\n"
            "auth.failure|192.0.2.8|x from 10.0.0.1 port 1|Journal\n"
            "auth.failure|192.0.2.9|last|Journal\n");

  // Stopped, the daemon misses nothing: a restart resumes after the saved cursor.
  SendAs("sshd", 0, "Failed password for during from 192.0.2.10 port 7 ssh2");
  startDaemon();
  SendAs("sshd", 0, "Failed password for after from 192.0.2.11 port 8 ssh2");
  ASSERT_TRUE(started->waitForLine(out, "|after|"));
  EXPECT_EQ(started->stop(), 0);
  EXPECT_THAT(ReadFile(out), ::testing::EndsWith("auth.failure|192.0.2.9|last|Journal\n"
                                                 "auth.failure|192.0.2.10|during|Journal\n"
                                                 "auth.failure|192.0.2.11|after|Journal\n"));
}

// Without a journal each record costs one message, announced once before the first; a flood
// leaves a few lines whose counts add up.
TEST_F(JournalTest, AFloodOfUndeliverableRecordsLeavesAFewLinesWhoseCountsAddUp) {
  constexpr int kEvents = 100'000;
  ASSERT_NE(access(kSocket, F_OK), 0);
  const std::string log =
      run({RuleXml("count", {"auth"}, {{"actions", Arr({FileLog("${event:n}", out)})}})}, 0,
          toJournal, [&](Daemon&) {
            ASSERT_EQ(SendEvents(socket, kEvents,
                                 [](int i) {
                                   return PlistDocument(Dict({{"eventType", Str("auth.failure")},
                                                              {"n", Str(std::to_string(i))}}));
                                 }),
                      "");
            ASSERT_TRUE(WaitForLines(out, kEvents, std::chrono::minutes(3)));
          });
  // Two records per event: one for its full type, which has no rules, and one after the rules
  // of "auth".
  const LineCount failed =
      CountLogLine(log, "Failed to log event auth.failure to KVLOG tarvod database");
  EXPECT_EQ(failed.written + failed.repeated, 2u * kEvents);
  EXPECT_EQ(CountLogLine(log, "Failed to log event shutdown to KVLOG tarvod database").written, 1u);
  EXPECT_LT(CountLines(errorLog), 100u) << log.substr(0, 4000);
  EXPECT_EQ(CountLogLine(log, kNowhereToGo).written, 1u);
  EXPECT_TRUE(LinesInOrder(log, {kNowhereToGo, "Failed to log event"})) << log.substr(0, 4000);
}

}  // namespace
}  // namespace tarvod::testing
