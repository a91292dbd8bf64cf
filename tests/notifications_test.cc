// Distributed notifications end to end: the real daemon on a private system bus started by
// the test, with tarvodctl post, busctl emit and the daemon's own post-notification action
// as senders.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "harness.h"
#include "platform/testing/private_bus.h"
#include "rules_xml.h"

namespace tarvod::testing {
namespace {

using ::testing::HasSubstr;

class NotificationsTest : public TarvodTest {
 protected:
  void SetUp() override { ASSERT_FALSE(bus.address().empty()) << "dbus-daemon did not start"; }

  // Starts the daemon and waits for its companion job, which a bus without systemd refuses.
  Daemon& startDaemon(const std::vector<std::string>& rules) {
    start(rules, 3, {{"authLogSource", Str("none")}});
    EXPECT_TRUE(started->waitForLine(errorLog, "Enable tarvlog job failed"));
    return *started;
  }
  // A rule for type that appends "<type> ${event:tag}" to the output file.
  std::string logRule(const std::string& type) {
    return RuleXml(type, {type}, {{"actions", Arr({FileLog(type + " ${event:tag}", out)})}});
  }
  static void expectSuccess(const RunResult& result) { EXPECT_EQ(result.status, 0) << result.err; }
  static void post(std::vector<std::string> args) {
    args.insert(args.begin(), "post");
    expectSuccess(Tarvodctl(args));
  }

  PrivateBus bus;
};

TEST_F(NotificationsTest, ObservedObjectsDeliverTheirUserInformationAsTheEvent) {
  const std::string crossed = dir.write(
      "crossed.plist", PlistDocument(Dict({{"eventType", Str("beta")},
                                           {"eventDetails", Dict({{"tag", Str("crossed")}})}})));
  const std::string echo =
      Dict({{"type", Str("postnotification")},
            {"name", Str("echoed")},
            {"message", Str("beta")},
            {"details", Dict({{"eventType", Str("beta")}, {"tag", Str("echoed")}})}});
  Daemon& daemon = startDaemon(
      {logRule("alpha"), logRule("beta"), RuleXml("echo", {"echo"}, {{"actions", Arr({echo})}})});
  // The bus error's text, and the daemon runs on.
  EXPECT_THAT(ReadFile(errorLog),
              HasSubstr("Enable tarvlog job failed The name org.freedesktop.systemd1 was not "
                        "provided by any .service files"));
  // Logged by the registration and again by startup once the sources listen.
  EXPECT_THAT(ReadFile(errorLog), HasSubstr("Registered 3 events\nStarting the New XPC event "
                                            "listener\nRegistered 3 events\n"));

  post({"n1", "alpha", "tag=ctl"});
  ASSERT_TRUE(daemon.waitForLine(out, "alpha ctl\n"));
  // The object selects delivery; the user information's eventType selects the rules.
  post({"--plist", crossed, "n2", "alpha"});
  ASSERT_TRUE(daemon.waitForLine(out, "beta crossed\n"));
  expectSuccess(
      RunProgram({"/usr/bin/busctl", "--system", "emit", "/com/quenta/DistributedNotifications",
                  "com.quenta.DistributedNotifications", "Notification", "ssa{sv}", "n4", "alpha",
                  "2", "eventType", "s", "alpha", "tag", "s", "busctl"}));
  ASSERT_TRUE(daemon.waitForLine(out, "alpha busctl\n"));
  // The daemon's own post comes back to it.
  post({"n5", "echo"});
  ASSERT_TRUE(daemon.waitForLine(out, "beta echoed\n"));

  EXPECT_EQ(ReadFile(out), "alpha ctl\nbeta crossed\nalpha busctl\nbeta echoed\n");
  EXPECT_THAT(ReadFile(errorLog), HasSubstr("DoNotificationAction: name = echoed message = beta"));
  EXPECT_EQ(daemon.stop(), 0);
}

// A rule job stuck on a full FIFO holds the reload between the old observations and the new:
// a notification posted then must still arrive after it.
TEST_F(NotificationsTest, ANotificationPostedDuringAReloadIsDeliveredAfterIt) {
  const std::string fifo = dir.file("fifo");
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  const int fd = open(fifo.c_str(), O_RDWR | O_NONBLOCK | O_CLOEXEC);
  ASSERT_GE(fd, 0);
  const std::string block(4096, 'x');
  while (write(fd, block.data(), block.size()) > 0) {
  }
  Daemon& daemon = startDaemon(
      {logRule("late"), RuleXml("stuck", {"block"}, {{"actions", Arr({FileLog("x", fifo)})}})});
  expectSuccess(Tarvodctl({"send", "--socket", socket, "block"}));
  ASSERT_TRUE(daemon.waitForLine(errorLog, "EVENT RECEIVED: block"));
  kill(daemon.pid(), SIGHUP);
  ASSERT_TRUE(daemon.waitForLine(errorLog, "Reloading Rules"));
  post({"during", "late", "tag=held"});
  usleep(300000);
  char drain[65536];
  while (read(fd, drain, sizeof drain) > 0) {
  }
  ASSERT_TRUE(daemon.waitForLine(out, "late held\n")) << ReadFile(errorLog);
  const std::string log = ReadFile(errorLog);
  const size_t reloaded = log.find("Registered 2 events", log.find("Reloading Rules"));
  EXPECT_LT(reloaded, log.find("NOTIFICATION RECEIVED: during"));
  EXPECT_EQ(daemon.stop(), 0);
  close(fd);
}

}  // namespace
}  // namespace tarvod::testing
