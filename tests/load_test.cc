// Load through the real daemon: many concurrent senders while the rules are reloaded, and
// floods of one failure in the error log.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <thread>
#include <utility>
#include <vector>

#include "harness.h"
#include "rules_xml.h"

namespace tarvod::testing {
namespace {

constexpr int kSenders = 8;
constexpr int kEventsPerSender = 25'000;
// An unbounded queue of 200,000 parsed events would take several hundred MiB; the bounded
// pipeline needs about 8 MiB.
constexpr long kResidentBoundKb = 32 * 1024;
// Sanitizer runtimes keep freed memory in quarantine and shadow every byte, so only the
// plain build measures the daemon's own memory.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kMeasuresOwnMemory = false;
#else
constexpr bool kMeasuresOwnMemory = true;
#endif

std::string EventPlist(const char* type, const char* key, const std::string& value) {
  return PlistDocument(
      Dict({{"eventType", Str(type)}, {"eventDetails", Dict({{key, Str(value)}})}}));
}

class LoadTest : public TarvodTest {};

// Twenty reloads while eight senders flood: no event lost or counted twice, the last rules
// run, and memory bounded while the engine lags (senders then wait in the kernel).
TEST_F(LoadTest, ReloadsUnderLoadLoseNoEventAndSwapInTheNewRules) {
  constexpr int kReloads = 20;
  const auto writeRules = [&](int generation) {
    const std::string g = std::to_string(generation);
    dir.write("rules/r.plist",
              RulesDocument({RuleXml("count", {"load"},
                                     {{"actions", Arr({FileLog("g" + g + " ${event:n}", out)})}}),
                             RuleXml("mark", {"startup.reload"},
                                     {{"actions", Arr({FileLog("reload " + g, out)})}})}));
  };
  writeRules(0);
  Daemon daemon({"-c", writeConfig(), "-r", dir.file("rules"), "-n", "-v", "1"}, dir);
  ASSERT_TRUE(daemon.waitForStartup(errorLog));

  std::vector<std::string> failures(kSenders);
  std::vector<std::thread> senders;
  for (int s = 0; s < kSenders; ++s) {
    senders.emplace_back([&, s] {
      failures[s] = SendEvents(socket, kEventsPerSender, [s](int i) {
        return EventPlist("load", "n", std::to_string(s) + "-" + std::to_string(i));
      });
    });
  }
  for (int g = 1; g <= kReloads; ++g) {
    writeRules(g);
    kill(daemon.pid(), SIGHUP);
    ASSERT_TRUE(daemon.waitForLine(out, "reload " + std::to_string(g) + "\n", 60s)) << g;
  }
  for (auto& t : senders) t.join();
  for (const std::string& failure : failures) ASSERT_EQ(failure, "");
  ASSERT_EQ(SendEvents(socket, 1, [](int) { return EventPlist("load", "n", "final"); }), "");
  // Connections are read in no fixed order: wait for every line, not for the last sent.
  const size_t expected = static_cast<size_t>(kSenders * kEventsPerSender + kReloads + 1);
  WaitForLines(out, expected, std::chrono::minutes(2));
  std::this_thread::sleep_for(std::chrono::milliseconds(200));  // nothing counted twice
  const std::string text = ReadFile(out);
  EXPECT_EQ(CountLines(out), expected);
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

// Each event's first log action fails ("missing/" does not exist) on one of two files; the
// second counts the events. A window's counts are written when it ends, while the daemon runs.
TEST_F(LoadTest, AFloodOfOneFailureLeavesAFewLinesWhoseCountsAddUp) {
  const struct {
    int repeatInterval;
    int events;
  } cases[] = {{2, 20'000}, {0, 2'000}};
  for (const auto& c : cases) {
    SCOPED_TRACE("logRepeatInterval " + std::to_string(c.repeatInterval));
    std::remove(errorLog.c_str());
    std::remove(out.c_str());
    const auto countsAddUp = [&] {
      const std::string log = ReadFile(errorLog);
      for (const char* which : {"a", "b"}) {
        const std::string line = "LOG: Cannot open " + dir.file("missing/") + which +
                                 " errno = 2 (rule \"flood\" in " + rulesPath + ")";
        const LineCount count = CountLogLine(log, line);
        if (count.written + count.repeated != static_cast<size_t>(c.events / 2)) return false;
        if (c.repeatInterval == 0 && count.written != static_cast<size_t>(c.events / 2)) {
          return false;
        }
      }
      return true;
    };
    const std::string log =
        run({RuleXml("flood", {"flood"},
                     {{"actions", Arr({FileLog("x", dir.file("missing/${event:which}")),
                                       FileLog("${event:which}", out)})}})},
            0, {{"logRepeatInterval", Int(c.repeatInterval)}}, [&](Daemon&) {
              ASSERT_EQ(
                  SendEvents(socket, c.events,
                             [](int i) { return EventPlist("flood", "which", i % 2 ? "b" : "a"); }),
                  "");
              ASSERT_TRUE(WaitForLines(out, c.events, std::chrono::minutes(3)));
              if (c.repeatInterval == 0) return;
              const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(15);
              while (!countsAddUp() && std::chrono::steady_clock::now() < deadline) {
                std::this_thread::sleep_for(std::chrono::milliseconds(100));
              }
              EXPECT_TRUE(countsAddUp()) << ReadFile(errorLog);
            });
    EXPECT_TRUE(countsAddUp()) << log.substr(0, 4000);
    // Records go to structuredLogPath, so nothing is said about a missing journal.
    EXPECT_EQ(log.find("nowhere to go"), std::string::npos);
    if (c.repeatInterval != 0) {
      EXPECT_LT(CountLines(errorLog), 100u);
    }
  }
}

}  // namespace
}  // namespace tarvod::testing
