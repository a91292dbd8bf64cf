#include "sources/event_listener.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <thread>

#include "platform/event_loop.h"
#include "platform/testing/log_capture.h"
#include "sources/monitor.h"
#include "sources/test_sink.h"

namespace tarvod {
namespace {

using testing::Client;
using testing::EventCollector;
using testing::EventXml;
using testing::XmlPlist;

class EventSocketTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/tarvod-listener-XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    mDirectory = pattern;
    mPath = mDirectory + "/run/evtq";
  }
  void TearDown() override {
    mMonitor.reset();
    std::filesystem::remove_all(mDirectory);
  }
  Monitor& start(bool backPressure = false, int idleSeconds = 0) {
    mMonitor = std::make_unique<Monitor>(mCollector.hooks(backPressure));
    mMonitor->setEventSocketPath(mPath);
    if (idleSeconds > 0) mMonitor->setConnectionIdleTimeout(idleSeconds);
    mMonitor->beginListening();
    return *mMonitor;
  }
  // Round trips through the input queue, so that what it could read has been read.
  void settle() {
    for (int i = 0; i < 20; ++i) mMonitor->inputQueue()->sync([] {});
  }

  std::string mDirectory;
  std::string mPath;
  EventCollector mCollector;
  std::unique_ptr<Monitor> mMonitor;
};

TEST(ConvertXPCEvent, StampsSenderIdsAsSignedDecimalUnlessTheSenderSetThem) {
  const auto stamped = ConvertXPCEvent({{"eventType", "x"}}, 4294967294u, 20);
  ASSERT_TRUE(stamped);
  EXPECT_EQ(*stamped->findString("senderUID"), "-2");
  EXPECT_EQ(*stamped->findString("senderGID"), "20");

  const auto kept = ConvertXPCEvent({{"eventType", "x"}, {"senderUID", "forged"}}, 501, 20);
  ASSERT_TRUE(kept);
  EXPECT_EQ(*kept->findString("senderUID"), "forged");
  EXPECT_EQ(*kept->findString("senderGID"), "20");
}

TEST_F(EventSocketTest, SocketIsOpenToEveryoneAndRemovedAtStopAfterWhatWasRead) {
  Monitor& monitor = start();
  struct stat socketStat, directoryStat;
  ASSERT_EQ(lstat(mPath.c_str(), &socketStat), 0);
  EXPECT_TRUE(S_ISSOCK(socketStat.st_mode));
  EXPECT_EQ(socketStat.st_mode & 0777, 0666u);
  ASSERT_EQ(stat((mDirectory + "/run").c_str(), &directoryStat), 0);
  EXPECT_EQ(directoryStat.st_mode & 0777, 0755u);
  Client client(mPath);
  for (int i = 0; i < 50; ++i) ASSERT_TRUE(client.send(EventXml("before.stop")));
  ASSERT_TRUE(mCollector.waitFor(50));
  monitor.stopListening();
  EXPECT_FALSE(std::filesystem::exists(mPath));
  EXPECT_FALSE(Client(mPath).connected());
  client.send(EventXml("after.stop"));  // may fail: the daemon's end is gone
  usleep(100'000);
  EXPECT_EQ(mCollector.size(), 50u);
}

TEST_F(EventSocketTest, MessagesOnOneConnectionAreEventsWithTheSameSenderTypedOrNot) {
  start();
  Client client(mPath);
  ASSERT_TRUE(client.connected());
  for (const char* type : {"a.one", "a.two", "a.three"}) ASSERT_TRUE(client.send(EventXml(type)));
  ASSERT_TRUE(client.send(XmlPlist("<dict><key>note</key><string>n</string></dict>")));
  ASSERT_TRUE(mCollector.waitFor(4));
  const auto events = mCollector.events();
  EXPECT_EQ(*events[0].findString("eventType"), "a.one");
  EXPECT_EQ(*events[2].findString("eventType"), "a.three");
  EXPECT_FALSE(events[3].contains("eventType"));
  for (const auto& event : events) {
    EXPECT_EQ(*event.findString("senderUID"), std::to_string(getuid()));
    EXPECT_EQ(*event.findString("senderGID"), std::to_string(getgid()));
  }
}

// Malformed and oversize packets are dropped; a message that is no dictionary ends the link.
TEST_F(EventSocketTest, BadPacketsAreDroppedAndANonDictionaryClosesTheConnection) {
  start();
  Client client(mPath);
  ASSERT_TRUE(client.send("this is no property list"));
  ASSERT_TRUE(client.send(""));
  ASSERT_TRUE(client.send("<plist><dict><key>unterminated"));
  ASSERT_TRUE(
      client.send(EventXml("too.big", "<key>pad</key><string>" +
                                          std::string(kMaxEventMessageBytes, 'p') + "</string>")));
  ASSERT_TRUE(client.send(EventXml("after.malformed")));
  ASSERT_TRUE(client.send(XmlPlist("<string>just text</string>")));
  char byte;
  EXPECT_EQ(recv(client.fd(), &byte, 1, 0), 0);  // the daemon closed its end
  Client other(mPath);
  ASSERT_TRUE(other.send(EventXml("still.listening")));
  ASSERT_TRUE(mCollector.waitFor(2));
  settle();
  const auto events = mCollector.events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(*events[0].findString("eventType"), "after.malformed");
}

TEST_F(EventSocketTest, EveryPacketSentBeforeTheSenderClosesIsHandled) {
  ::tarvod::testing::LogCapture capture(4);
  Monitor& monitor = start();
  // Not accepted until everything is queued, so the daemon first sees the connection with its
  // packets and its end at once.
  monitor.suspend();
  {
    Client client(mPath);
    ASSERT_TRUE(client.send(EventXml("before.empty")));
    ASSERT_TRUE(client.send(""));
    ASSERT_TRUE(client.send(EventXml("after.empty")));
    ASSERT_TRUE(client.send(""));
  }
  monitor.resume();
  ASSERT_TRUE(mCollector.waitFor(2)) << capture.text();
  settle();
  const auto events = mCollector.events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(*events[1].findString("eventType"), "after.empty");
  const std::string log = capture.text();
  const std::string malformed = "XPC Malformed event received from " + std::to_string(getuid());
  const size_t first = log.find(malformed);
  ASSERT_NE(first, std::string::npos) << log;
  EXPECT_NE(log.find(malformed, first + 1), std::string::npos) << log;
  EXPECT_TRUE(::tarvod::testing::LinesInOrder(log, {malformed, "peer error: Connection invalid"}));
}

TEST_F(EventSocketTest, AConnectionThatSendsNothingIsClosedAfterTheIdleTimeout) {
  ::tarvod::testing::LogCapture capture(1);
  start(false, 1);
  Client idle(mPath);
  Client busy(mPath);
  ASSERT_TRUE(busy.send(EventXml("busy.first")));
  std::this_thread::sleep_for(std::chrono::milliseconds(500));
  ASSERT_TRUE(busy.send(EventXml("busy.second")));
  ASSERT_TRUE(mCollector.waitFor(2));
  // The daemon closes the silent connection about a second after accepting it.
  const timeval wait{5, 0};
  setsockopt(idle.fd(), SOL_SOCKET, SO_RCVTIMEO, &wait, sizeof wait);
  char byte;
  EXPECT_EQ(recv(idle.fd(), &byte, 1, 0), 0);
  // The one that sent half a second later is still served.
  ASSERT_TRUE(busy.send(EventXml("busy.third")));
  EXPECT_TRUE(mCollector.waitFor(3));
  EXPECT_NE(
      capture.text().find("Closing the connection from " + std::to_string(getuid()) + ":" +
                          std::to_string(getgid()) + " (uid:gid): nothing sent for 1 seconds\n"),
      std::string::npos)
      << capture.text();
}

// A socket file left by a crash is replaced; a live socket or anything else is left alone.
TEST_F(EventSocketTest, OnlyAStaleSocketFileAtThePathIsReplaced) {
  std::filesystem::create_directories(mDirectory + "/run");
  SocketResult live = ListenSeqpacket(mPath, 1);
  ASSERT_GE(live.fd, 0);
  Monitor* monitor = &start();
  EXPECT_EQ(monitor->SetXPCListenerFor(*monitor->inputQueue()), -1);
  mMonitor.reset();
  close(live.fd);  // the file stays behind, as after a crash
  ASSERT_TRUE(std::filesystem::is_socket(mPath));
  start();
  Client client(mPath);
  ASSERT_TRUE(client.send(EventXml("after.stale")));
  EXPECT_TRUE(mCollector.waitFor(1));
  mMonitor.reset();

  std::filesystem::remove(mPath);
  std::ofstream(mPath) << "precious";
  monitor = &start();
  EXPECT_EQ(monitor->SetXPCListenerFor(*monitor->inputQueue()), -1);
  std::ifstream in(mPath);
  std::string content;
  in >> content;
  EXPECT_EQ(content, "precious");
}

TEST_F(EventSocketTest, ConnectionsBeyondTheLimitWaitUntilOneCloses) {
  start();
  std::vector<std::unique_ptr<Client>> clients;
  for (size_t i = 0; i < kMaxPeerConnections; ++i) {
    clients.push_back(std::make_unique<Client>(mPath));
    ASSERT_TRUE(clients.back()->send(EventXml("first")));
  }
  ASSERT_TRUE(mCollector.waitFor(kMaxPeerConnections));
  // Connecting succeeds (the kernel queues it), but the connection is not served yet.
  Client waiting(mPath);
  ASSERT_TRUE(waiting.connected());
  ASSERT_TRUE(waiting.send(EventXml("waiting")));
  ASSERT_TRUE(clients[1]->send(EventXml("served")));
  ASSERT_TRUE(mCollector.waitFor(kMaxPeerConnections + 1));
  settle();
  EXPECT_EQ(*mCollector.events().back().findString("eventType"), "served");
  EXPECT_EQ(mCollector.size(), kMaxPeerConnections + 1);

  clients[0].reset();
  ASSERT_TRUE(mCollector.waitFor(kMaxPeerConnections + 2));
  EXPECT_EQ(*mCollector.events().back().findString("eventType"), "waiting");
}

TEST_F(EventSocketTest, ReadingStopsWhileTheProcessingBacklogIsOverItsLimit) {
  mCollector.setBacklog(kBackPressureHighJobs + 1);
  start(true);
  Client client(mPath);
  ASSERT_TRUE(client.send(EventXml("first")));
  ASSERT_TRUE(mCollector.waitFor(1));
  ASSERT_TRUE(client.send(EventXml("held")));
  settle();
  EXPECT_EQ(mCollector.size(), 1u) << "nothing is read while the backlog is high";
  EXPECT_EQ(mCollector.backlogSignalLimit(), kBackPressureLowJobs);
  mCollector.setBacklog(kBackPressureLowJobs + 1);
  settle();
  EXPECT_EQ(mCollector.size(), 1u) << "still above the low mark";
  mCollector.setBacklog(kBackPressureLowJobs);
  ASSERT_TRUE(mCollector.waitFor(2));
  EXPECT_EQ(*mCollector.events()[1].findString("eventType"), "held");
}

TEST_F(EventSocketTest, SuspendStopsAcceptingButServesAcceptedConnections) {
  Monitor& monitor = start();
  Client early(mPath);
  ASSERT_TRUE(early.send(EventXml("early")));
  ASSERT_TRUE(mCollector.waitFor(1));
  monitor.suspend();
  Client late(mPath);
  ASSERT_TRUE(late.send(EventXml("late")));
  ASSERT_TRUE(early.send(EventXml("early.again")));
  ASSERT_TRUE(mCollector.waitFor(2));
  settle();
  EXPECT_EQ(mCollector.size(), 2u);
  monitor.resume();
  ASSERT_TRUE(mCollector.waitFor(3));
  EXPECT_EQ(*mCollector.events()[2].findString("eventType"), "late");
}

}  // namespace
}  // namespace tarvod
