// The event sources against the real daemon: senders under other identities and the sender
// filter, the event socket's message handling, the missing audit pipe, and tarvodctl.
#include <gmock/gmock.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <plist/plist.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>

#include "harness.h"
#include "platform/seqpacket.h"
#include "rules_xml.h"

namespace tarvod::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

// A message for the event socket: { eventType; eventDetails = { tag }; }.
std::string EventMessage(std::string_view type, std::string_view tag) {
  return PlistDocument(
      Dict({{"eventType", Str(type)}, {"eventDetails", Dict({{"tag", Str(tag)}})}}));
}

// Sends one packet as the given identity, from a child process that takes the identity before
// it connects (the daemon reads the peer's IDs at connection time). True when it was sent.
bool SendAs(uid_t uid, gid_t gid, const std::string& socketPath, const std::string& message) {
  const pid_t child = fork();
  if (child == 0) {
    if (setgroups(0, nullptr) != 0 || setgid(gid) != 0 || setuid(uid) != 0) _exit(3);
    const SocketResult connection = ConnectSeqpacket(socketPath);
    if (connection.fd < 0) _exit(4);
    std::string error;
    _exit(SendPacket(connection.fd, message, &error) ? 0 : 5);
  }
  int status = 0;
  waitpid(child, &status, 0);
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

// The daemon with one rule on "t" that appends "tag uid gid" for every event to out.log.
class SourcesTest : public TarvodTest {
 protected:
  void startDaemon(ConfigEntries config = {}) {
    config.push_back({"authLogSource", Str("auditpipe")});
    start({RuleXml("record", {"t"},
                   {{"actions",
                     Arr({FileLog("${event:tag} ${event:senderUID} ${event:senderGID}", out)})}})},
          4, config);
  }
  std::string log() const { return ReadFile(errorLog); }
  bool waitForEvent(std::string_view line) { return started->waitForLine(out, line); }
};

// The parsing and matching of the lists are the monitor's unit tests; here real senders'
// credentials go through the daemon's configuration.
TEST_F(SourcesTest, TheSenderFilterDecidesWhichSendersReachARule) {
  startDaemon({{"filterByUID", Str("1001")}, {"filterByGID", Str("3005")}});
  const struct {
    uid_t uid;
    gid_t gid;
    bool admitted;
  } senders[] = {{1001, 3000, true}, {1002, 3005, true}, {1002, 3000, false}};
  for (const auto& s : senders) {
    const std::string ids = std::to_string(s.uid) + " " + std::to_string(s.gid);
    // A refused sender's connection may be closed before its packet is written.
    const bool sent = SendAs(s.uid, s.gid, socket, EventMessage("t", "from " + ids));
    if (s.admitted) {
      ASSERT_TRUE(sent);
      EXPECT_TRUE(waitForEvent("from " + ids + " " + ids + "\n")) << log();
    } else {
      EXPECT_TRUE(started->waitForLine(errorLog, "XPC Event rejected from " +
                                                     std::to_string(s.uid) + ":" +
                                                     std::to_string(s.gid) + " (uid:gid)"))
          << log();
      EXPECT_THAT(log(), HasSubstr("Blocked event because user with ID " + std::to_string(s.uid) +
                                   " is not in the allowed UID list"));
    }
  }
  EXPECT_EQ(started->stop(), 0);
  EXPECT_THAT(ReadFile(out), Not(HasSubstr("from 1002 3000")));
}

TEST_F(SourcesTest, IdleConnectionsOfOneUserCannotShutOutOtherSenders) {
  startDaemon();
  // An unprivileged user opens far more connections than the daemon serves and sends nothing.
  int ready[2];
  ASSERT_EQ(pipe(ready), 0);
  const pid_t holder = fork();
  if (holder == 0) {
    close(ready[0]);
    if (setgroups(0, nullptr) != 0 || setgid(65534) != 0 || setuid(65534) != 0) _exit(3);
    for (int i = 0; i < 300; ++i) {
      if (ConnectSeqpacket(socket).fd < 0) _exit(4);
    }
    if (write(ready[1], "r", 1) != 1) _exit(5);
    pause();
    _exit(0);
  }
  close(ready[1]);
  pollfd waiting{ready[0], POLLIN, 0};
  const bool opened = poll(&waiting, 1, 30'000) == 1;
  char byte = 0;
  const bool held = opened && read(ready[0], &byte, 1) == 1;
  close(ready[0]);
  ASSERT_TRUE(SendAs(0, 0, socket, EventMessage("t", "root")));
  EXPECT_TRUE(waitForEvent("root 0 0\n")) << log();
  kill(holder, SIGKILL);
  waitpid(holder, nullptr, 0);
  EXPECT_TRUE(held) << "the 300 connections could not all be opened";
  EXPECT_THAT(log(), HasSubstr("XPC Connection refused from 65534:65534 (uid:gid): the user holds "
                               "32 connections\n"));
}

std::string BigEndian(uint64_t value, size_t size) {
  std::string out(size, '\0');
  for (size_t i = 0; i < size; ++i) out[size - 1 - i] = static_cast<char>(value >> (8 * i));
  return out;
}

// A binary property list whose top object is a container holding `references` two-byte
// references to object 1, a string (0x5) or data (0x4) object of `length` bytes. A dictionary
// of n entries is 2n references, so the payload is then every key as well as every value.
std::string SharedPayloadList(char container, char payloadType, size_t references, size_t length) {
  const size_t count = container == 'd' ? references / 2 : references;
  std::string out = "bplist00";
  const uint64_t top = out.size();
  out += std::string(1, container == 'd' ? '\xDF' : '\xAF') + "\x11" + BigEndian(count, 2);
  for (size_t i = 0; i < references; ++i) out += BigEndian(1, 2);
  const uint64_t payload = out.size();
  out += std::string(1, static_cast<char>(payloadType << 4 | 0x0F)) + "\x12" +
         BigEndian(length, 4) + std::string(length, 'p');
  const uint64_t table = out.size();
  out += BigEndian(top, 4) + BigEndian(payload, 4);
  return out + std::string(6, '\0') + "\x04\x02" + BigEndian(2, 8) + BigEndian(0, 8) +
         BigEndian(table, 8);
}

// An event as a real writer encodes it: libplist's binary writer stores each distinct string
// once, so its 3,000 records share a handful of short strings.
std::string SharedShortStringsEvent() {
  plist_t details = plist_new_dict();
  plist_t records = plist_new_array();
  for (int i = 0; i < 3000; ++i) {
    plist_t record = plist_new_dict();
    plist_dict_set_item(record, "path", plist_new_string(i % 2 ? "/usr/bin/ssh" : "/bin/sh"));
    plist_dict_set_item(record, "user", plist_new_string("root"));
    plist_dict_set_item(record, "result", plist_new_string("allowed"));
    plist_array_append_item(records, record);
  }
  plist_dict_set_item(details, "tag", plist_new_string("shared"));
  plist_dict_set_item(details, "records", records);
  plist_t event = plist_new_dict();
  plist_dict_set_item(event, "eventType", plist_new_string("t"));
  plist_dict_set_item(event, "eventDetails", details);
  char* bytes = nullptr;
  uint32_t length = 0;
  plist_to_bin(event, &bytes, &length);
  std::string out(bytes, length);
  plist_to_bin_free(bytes);
  plist_free(event);
  return out;
}

TEST_F(SourcesTest, SharedPayloadsCannotExhaustTheDaemonsMemory) {
  startDaemon();
  const SocketResult connection = ConnectSeqpacket(socket);
  ASSERT_GE(connection.fd, 0) << connection.error;
  const long before = PeakResidentKb(started->pid());
  ASSERT_GT(before, 0);
  // Each would expand to 1 to 4 GB: 32,000 references to one 32,000-byte payload in an
  // array, 64,000 to one of 64,000 bytes in a dictionary.
  const std::string hostile[] = {
      SharedPayloadList('a', 0x5, 32000, 32000),
      SharedPayloadList('a', 0x4, 32000, 32000),
      SharedPayloadList('d', 0x5, 64000, 64000),
      SharedPayloadList('d', 0x4, 64000, 64000),
  };
  const auto start = std::chrono::steady_clock::now();
  std::string error;
  for (const std::string& bytes : hostile) {
    ASSERT_TRUE(SendPacket(connection.fd, bytes, &error)) << error;
  }
  const std::string legitimate = SharedShortStringsEvent();
  ASSERT_TRUE(SendPacket(connection.fd, legitimate, &error)) << error;
  ASSERT_TRUE(waitForEvent("shared 0 0\n")) << log();
  const auto elapsed = std::chrono::steady_clock::now() - start;
  EXPECT_LT(elapsed, 5s);
  const std::string text = log();
  size_t malformed = 0;
  for (size_t at = text.find("XPC Malformed event received from 0:0 (uid:gid)");
       at != std::string::npos; at = text.find("XPC Malformed event", at + 1)) {
    ++malformed;
  }
  EXPECT_EQ(malformed, std::size(hostile));
  const long growthKb = PeakResidentKb(started->pid()) - before;
  EXPECT_LT(growthKb, 32 * 1024) << "peak grew by " << growthKb << " kB";
  close(connection.fd);
}

// The audit pipe is missing here: it is reported and the other sources serve on.
TEST_F(SourcesTest, TarvodctlSendsEventsFromArgumentsAndFromAPropertyListFile) {
  startDaemon();
  EXPECT_TRUE(started->waitForLine(errorLog, "Failed to open the Auditpipe error = 2\n"));
  EXPECT_THAT(log(), HasSubstr("open of /dev/auditpipe failed errno = 2\n"));
  EXPECT_THAT(started->stderrText(), HasSubstr("failed to open the auditpipe: "));
  RunResult sent = Tarvodctl({"-c", dir.file("tarvod.plist"), "send", "t", "tag=ctl"});
  EXPECT_EQ(sent.status, 0) << sent.err;
  EXPECT_TRUE(waitForEvent("ctl 0 0\n")) << log();

  const std::string file = dir.write("event.plist", EventMessage("t", "fromfile"));
  sent = Tarvodctl({"send", "--socket", socket, "--plist", file});
  EXPECT_EQ(sent.status, 0) << sent.err;
  EXPECT_TRUE(waitForEvent("fromfile 0 0\n")) << log();
}

TEST_F(SourcesTest, TarvodctlExplainsWhyItCouldNotSend) {
  const std::string array = dir.write("array.plist", PlistDocument("<array/>"));
  const std::string big =
      dir.write("big.plist", EventMessage("t", std::string(1024 * 1024 + 1, 'b')));
  const struct {
    std::vector<std::string> args;
    int status;
    std::string message;
  } cases[] = {
      {{"send", "--socket", socket, "t", "a=b"}, 1, "tarvod is not listening"},
      {{"send", "--socket", socket, "--plist", array}, 1, array + " is not a dictionary"},
      {{"send", "--socket", socket, "--plist", big}, 1, "the message is too large"},
      {{"send"}, 2, "usage: tarvodctl"},
  };
  for (const auto& c : cases) {
    const RunResult result = Tarvodctl(c.args);
    EXPECT_EQ(result.status, c.status) << c.message;
    EXPECT_THAT(result.err, HasSubstr(c.message));
  }
}

}  // namespace
}  // namespace tarvod::testing
