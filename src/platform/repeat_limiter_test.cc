#include "platform/repeat_limiter.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/testing/fake_clock.h"

namespace tarvod {
namespace {

// Feeds texts to a limiter one step at a time; "+N" moves the clock N seconds. The result is
// the log as it would be written: admitted texts and summary lines in order.
std::vector<std::string> Feed(RepeatLimiter& limiter, FakeClock& clock,
                              const std::vector<std::string>& steps) {
  std::vector<std::string> written;
  for (const std::string& step : steps) {
    if (step[0] == '+') {
      clock.advance(std::stod(step.substr(1)));
      continue;
    }
    std::vector<std::string> summaries;
    const bool admitted = limiter.admit(step, summaries);
    written.insert(written.end(), summaries.begin(), summaries.end());
    if (admitted) written.push_back(step);
  }
  return written;
}

TEST(RepeatLimiter, WritesTheFirstLineCountsRepeatsAndSummarisesWhenTheIntervalEnds) {
  FakeClock clock{1000};
  RepeatLimiter limiter(clock, 10);
  EXPECT_EQ(Feed(limiter, clock,
                 {"LOG: Cannot open /a errno = 2", "LOG: Cannot open /a errno = 2", "+9.9",
                  "LOG: Cannot open /a errno = 2", "+0.1", "other"}),
            (std::vector<std::string>{
                "LOG: Cannot open /a errno = 2",
                "LOG: Cannot open /a errno = 2 repeated 2 times in the last 10 s", "other"}));
  // After its window the text is a first occurrence again; a window without repeats ends
  // without a summary.
  EXPECT_EQ(Feed(limiter, clock, {"LOG: Cannot open /a errno = 2", "+10", "other", "+10", "x"}),
            (std::vector<std::string>{"LOG: Cannot open /a errno = 2", "other", "x"}));
}

TEST(RepeatLimiter, NeverCountsDifferentTextsTogether) {
  FakeClock clock{1000};
  RepeatLimiter limiter(clock, 10);
  const std::string longPrefix(2000, 'p');
  const std::vector<std::string> texts = {
      "Error: a", "Error: b", "Error: a ", "error: a", longPrefix + "1", longPrefix + "2", ""};
  std::vector<std::string> steps = texts;
  steps.insert(steps.end(), texts.begin(), texts.end());
  steps.insert(steps.end(), texts.begin(), texts.end());
  EXPECT_EQ(Feed(limiter, clock, steps), texts);
  std::vector<std::string> summaries;
  limiter.collectAll(summaries);
  std::vector<std::string> expected;
  for (const auto& text : texts) expected.push_back(text + " repeated 2 times in the last 10 s");
  EXPECT_EQ(summaries, expected);
}

TEST(RepeatLimiter, AZeroIntervalWritesEveryLine) {
  FakeClock clock{1000};
  RepeatLimiter limiter(clock, 0);
  EXPECT_EQ(Feed(limiter, clock, {"a", "a", "a"}), (std::vector<std::string>{"a", "a", "a"}));
  EXPECT_EQ(limiter.nextEnd(), std::nullopt);
}

TEST(RepeatLimiter, TheOldestWindowEndsEarlyWhenEveryKeyIsInUse) {
  FakeClock clock{1000};
  RepeatLimiter limiter(clock, 10, 2);
  EXPECT_EQ(Feed(limiter, clock, {"a", "a", "+1", "b", "c", "b", "a"}),
            (std::vector<std::string>{"a", "b", "a repeated 1 times in the last 10 s", "c",
                                      "b repeated 1 times in the last 10 s", "a"}));
  EXPECT_EQ(limiter.nextEnd(), clock.now() + 10);
}

TEST(RepeatLimiter, ReportsTheEndOfTheEarliestWindowAndCollectsOnlyEndedOnes) {
  FakeClock clock{1000};
  RepeatLimiter limiter(clock, 10);
  const double start = clock.now();
  EXPECT_EQ(Feed(limiter, clock, {"a", "a", "+4", "b", "b", "b"}),
            (std::vector<std::string>{"a", "b"}));
  EXPECT_EQ(limiter.nextEnd(), start + 10);
  clock.advance(6);
  std::vector<std::string> summaries;
  limiter.collectEnded(summaries);
  EXPECT_EQ(summaries, std::vector<std::string>{"a repeated 1 times in the last 10 s"});
  EXPECT_EQ(limiter.nextEnd(), start + 14);
}

}  // namespace
}  // namespace tarvod
