#include "sources/monitor.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "platform/event_loop.h"
#include "platform/testing/log_capture.h"
#include "sources/test_sink.h"

namespace tarvod {
namespace {

using testing::EventCollector;

struct FilterTextCase {
  std::optional<std::string> text;
  std::optional<IdSet> expected;
};

TEST(ParseFilterList, ReadsEachPieceAsALeadingInteger) {
  const std::vector<FilterTextCase> cases = {
      {std::nullopt, std::nullopt},
      {"", std::nullopt},
      {"501", IdSet{501}},
      {"0,501", IdSet{0, 501}},
      {" 501", IdSet{501}},
      {"501abc", IdSet{501}},
      {"abc", IdSet{0}},
      {"501,", IdSet{0, 501}},
      {",", IdSet{0}},
      {"-1", IdSet{-1}},
      {"20,20,+20", IdSet{20}},
      {"\u00a01000,\u20021001", IdSet{1000, 1001}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.text.value_or("(absent)"));
    EXPECT_EQ(ParseFilterList(c.text), c.expected);
  }
}

struct FilterCase {
  const char* uids;  // nullptr: no list
  const char* gids;
  uint32_t uid;
  uint32_t gid;
  bool allowed;
};

TEST(FilterBySourceUID, AdmitsASenderWhoseUserOrGroupIsListed) {
  const std::vector<FilterCase> cases = {
      {nullptr, nullptr, 502, 20, true},
      {"0,501", nullptr, 0, 80, true},
      {"0,501", nullptr, 501, 0, true},
      {"0,501", nullptr, 502, 20, false},
      {nullptr, "20", 502, 20, true},
      {nullptr, "20", 502, 21, false},
      {"501", "80", 501, 20, true},
      {"501", "80", 0, 80, true},
      {"501", "80", 0, 0, false},
      {"-1", nullptr, 4294967295u, 0, false},  // unsigned IDs never match a negative entry
      {"-1", "20", 7, 20, true},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(::testing::Message() << (c.uids ? c.uids : "-") << " / " << (c.gids ? c.gids : "-")
                                      << " for " << c.uid << ":" << c.gid);
    Monitor monitor({});
    auto parse = [](const char* text) {
      return ParseFilterList(text ? std::optional<std::string_view>(text) : std::nullopt);
    };
    monitor.setEventFilterUID(parse(c.uids), parse(c.gids));
    EXPECT_EQ(monitor.filterBySourceUID(c.uid, c.gid), c.allowed);
  }
}

// The rejected sender's line and the missing audit pipe are checked on the daemon in tests/.
TEST(Monitor, ProcessEventLogsTheEventAndDispatchesIt) {
  testing::LogCapture capture(3);
  EventCollector collector;
  Monitor monitor(collector.hooks());
  monitor.processEvent({{"eventType", "x.y"}});
  EXPECT_EQ(collector.size(), 1u);
  EXPECT_NE(capture.text().find("Event received: {\n    eventType = x.y;\n} \n"), std::string::npos)
      << capture.text();
}

TEST(Monitor, AListenerThatCannotStartIsReportedAndNothingElseStops) {
  testing::LogCapture capture(3);
  const std::string taken = capture.directory() + "/taken";
  std::ofstream(taken) << "a file";
  Monitor monitor({});
  monitor.setEventSocketPath(taken);
  monitor.beginListening();
  monitor.suspend();
  monitor.resume();
  monitor.stopListening();
  const std::string text = capture.text();
  EXPECT_NE(text.find("XPC event listener failed to start up\n"), std::string::npos);
  EXPECT_NE(text.find("Opening the BSM Auditpipe\n"), std::string::npos);
  EXPECT_TRUE(std::filesystem::is_regular_file(taken));
}

TEST(Monitor, StopListeningRunsEveryJobAlreadyOnTheInputQueue) {
  EventCollector collector;
  Monitor monitor(collector.hooks());
  monitor.setEventSocketPath("/tmp/tarvod-monitor-drain-" + std::to_string(getpid()));
  monitor.beginListening();
  for (int i = 0; i < 100; ++i) {
    monitor.inputQueue()->post([&monitor] { monitor.processEvent({{"eventType", "queued"}}); });
  }
  monitor.stopListening();
  EXPECT_EQ(collector.size(), 100u);
}

}  // namespace
}  // namespace tarvod
