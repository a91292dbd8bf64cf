// Load without loss: many concurrent senders against one counting rule. Every event must be
// counted, and the daemon's memory must stay bounded while the rule engine lags behind the
// senders (the event socket then stops reading and senders wait in the kernel). And a flood
// of one failure must leave a few counted lines in the error log, not one line per event.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <optional>
#include <thread>
#include <utility>
#include <vector>

#include "harness.h"
#include "rules_xml.h"

namespace tarvod::testing {
namespace {

constexpr int kSenders = 8;
constexpr int kEventsPerSender = 25'000;
// The daemon's peak resident memory must stay below this. An unbounded queue of 200,000
// parsed events and their rule jobs would take several hundred MiB; the bounded pipeline
// needs a small fraction of it (about 8 MiB here).
constexpr long kResidentBoundKb = 32 * 1024;
// Sanitizer runtimes keep freed memory in quarantine and shadow every byte, so only the
// plain build measures the daemon's own memory.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kMeasuresOwnMemory = false;
#else
constexpr bool kMeasuresOwnMemory = true;
#endif

std::string EventPlist(const char* type, const std::string& n) {
  return PlistDocument(Dict({{"eventType", Str(type)}, {"eventDetails", Dict({{"n", Str(n)}})}}));
}

// SIGHUP twenty times while eight senders flood: no event is lost or counted twice, each
// reload is one reload, the rules read by the last one are the ones that run, and memory stays
// bounded while the rule engine lags behind the senders (the event socket then stops reading
// and senders wait in the kernel).
TEST(Load, ReloadsUnderLoadLoseNoEventAndSwapInTheNewRules) {
  constexpr int kReloads = 20;
  constexpr int kEventsEach = kEventsPerSender;
  TempDir dir;
  const std::string socketPath = dir.file("run/evtq");
  const std::string counted = dir.file("counted.log");
  const std::string config =
      dir.write("tarvod.plist", ConfigPlist({{"errorLogPath", Str(dir.file("error.log"))},
                                             {"structuredLogPath", Str(dir.file("records.jsonl"))},
                                             {"eventSocketPath", Str(socketPath)}}));
  const auto writeRules = [&](int generation) {
    const std::string g = std::to_string(generation);
    dir.write(
        "rules/r.plist",
        RulesDocument({RuleXml("count", {"load"},
                               {{"actions", Arr({FileLog("g" + g + " ${event:n}", counted)})}}),
                       RuleXml("mark", {"startup.reload"},
                               {{"actions", Arr({FileLog("reload " + g, counted)})}})}));
  };
  writeRules(0);
  Daemon daemon({"-c", config, "-r", dir.file("rules"), "-n", "-v", "1"}, dir);
  ASSERT_TRUE(daemon.waitForStartup(dir.file("error.log")));

  std::vector<std::string> failures(kSenders);
  std::vector<std::thread> senders;
  for (int s = 0; s < kSenders; ++s) {
    senders.emplace_back([&, s] {
      failures[s] = SendEvents(socketPath, kEventsEach, [s](int i) {
        return EventPlist("load", std::to_string(s) + "-" + std::to_string(i));
      });
    });
  }
  for (int g = 1; g <= kReloads; ++g) {
    writeRules(g);
    kill(daemon.pid(), SIGHUP);
    ASSERT_TRUE(daemon.waitForLine(counted, "reload " + std::to_string(g) + "\n", 60s)) << g;
  }
  for (auto& t : senders) t.join();
  for (const std::string& failure : failures) ASSERT_EQ(failure, "");
  ASSERT_EQ(SendEvents(socketPath, 1, [](int) { return EventPlist("load", "final"); }), "");
  // Connections are read in no fixed order: wait for every line, not for the last sent.
  const size_t expected = static_cast<size_t>(kSenders * kEventsEach + kReloads + 1);
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::minutes(2);
  while (CountLines(counted) < expected && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
  }
  std::this_thread::sleep_for(std::chrono::milliseconds(200));  // nothing counted twice
  const std::string text = ReadFile(counted);
  EXPECT_EQ(CountLines(counted), expected);
  EXPECT_NE(text.find("g" + std::to_string(kReloads) + " final\n"), std::string::npos);
  size_t reloads = 0;
  for (size_t at = text.find("reload "); at != std::string::npos;
       at = text.find("reload ", at + 1)) {
    ++reloads;
  }
  EXPECT_EQ(reloads, static_cast<size_t>(kReloads));
  // One previous rulebase is kept, not every one, and the backlog inside the daemon is bounded.
  const long hwm = PeakResidentKb(daemon.pid());
  std::printf("daemon peak resident memory: %ld kB, bound %ld kB\n", hwm, kResidentBoundKb);
  if (kMeasuresOwnMemory) {
    EXPECT_LT(hwm, kResidentBoundKb);
  }
  EXPECT_EQ(daemon.stop(), 0);
}

// A rule whose first log action cannot open its file ("missing/" does not exist), so that each
// event logs "LOG: Cannot open ..."; events alternate between two such files. The second
// action counts the events that ran.
struct FloodCase {
  const char* name;
  std::optional<int> repeatInterval;  // logRepeatInterval; nullopt: absent
  int events;
  // true: the counts must add up while the daemon still runs (the summary of the last window
  // is written when the window ends, with no further line); false: once it has stopped.
  bool countsBeforeStop;
};

TEST(Load, AFloodOfOneFailureLeavesAFewLinesWhoseCountsAddUp) {
  const FloodCase cases[] = {
      {"default interval", std::nullopt, 100'000, false},
      {"2 s interval", 2, 20'000, true},
      {"limit off", 0, 2'000, false},
  };
  for (const FloodCase& c : cases) {
    SCOPED_TRACE(c.name);
    TempDir dir;
    const std::string errorLog = dir.file("error.log");
    const std::string socketPath = dir.file("evtq");
    const std::string counted = dir.file("counted.log");
    std::vector<std::pair<std::string, std::string>> config = {
        {"errorLogPath", Str(errorLog)},
        {"structuredLogPath", Str(dir.file("records.jsonl"))},
        {"stateDirectory", Str(dir.path())},
        {"eventSocketPath", Str(socketPath)}};
    if (c.repeatInterval) config.emplace_back("logRepeatInterval", Int(*c.repeatInterval));
    const std::string configPath = dir.write("tarvod.plist", ConfigPlist(config));
    const std::string rules = dir.write(
        "rules.plist",
        RulesDocument({RuleXml("flood", {"flood"},
                               {{"actions", Arr({FileLog("x", dir.file("missing/${event:which}")),
                                                 FileLog("${event:which}", counted)})}})}));
    Daemon daemon({"-c", configPath, "-r", rules, "-n"}, dir);
    ASSERT_EQ(SendEvents(socketPath, c.events,
                         [](int i) {
                           return PlistDocument(
                               Dict({{"eventType", Str("flood")},
                                     {"eventDetails", Dict({{"which", Str(i % 2 ? "b" : "a")}})}}));
                         }),
              "");
    ASSERT_TRUE(WaitForLines(counted, c.events, std::chrono::minutes(3)));

    const auto countsAddUp = [&] {
      const std::string log = ReadFile(errorLog);
      for (const char* which : {"a", "b"}) {
        const std::string line = "LOG: Cannot open " + dir.file("missing/") + which +
                                 " errno = 2 (rule \"flood\" in " + rules + ")";
        const LineCount count = CountLogLine(log, line);
        if (count.written + count.repeated != static_cast<size_t>(c.events / 2)) return false;
        if (c.repeatInterval == 0 && count.written != static_cast<size_t>(c.events / 2)) {
          return false;
        }
      }
      return true;
    };
    if (c.countsBeforeStop) {
      const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(15);
      while (!countsAddUp() && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
      }
      EXPECT_TRUE(countsAddUp()) << ReadFile(errorLog);
    }
    EXPECT_EQ(daemon.stop(), 0);
    EXPECT_TRUE(countsAddUp()) << ReadFile(errorLog).substr(0, 4000);
    // Records go to structuredLogPath, so nothing is said about a missing journal.
    EXPECT_EQ(ReadFile(errorLog).find("nowhere to go"), std::string::npos);
    if (c.repeatInterval != 0) {
      EXPECT_LT(CountLines(errorLog), 100u);
    }
  }
}

}  // namespace
}  // namespace tarvod::testing
