#include "sources/periodic_events.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <time.h>

#include "platform/testing/fake_timers.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Dictionary;
using plist::Value;

// An instant written with its zone offset, so that each expectation states the local time
// and the offset in force.
double At(const char* text) { return plist::ParseDate(text).value().secondsSince2001; }

std::string Local(double instant) { return plist::FormatDate(plist::Date{instant}, true); }

class ZoneScope {
 public:
  explicit ZoneScope(const char* zone) {
    setenv("TZ", zone, 1);
    tzset();
  }
  ~ZoneScope() {
    unsetenv("TZ");
    tzset();
  }
};

struct Fired {
  double at;
  Dictionary event;
};

class PeriodicEventsTest : public ::testing::Test {
 protected:
  static MonitorHooks Record(PeriodicEventsTest* test) {
    MonitorHooks hooks;
    hooks.dispatch = [test](const Dictionary& event) {
      test->fired_.push_back({test->clock_.now(), event});
    };
    return hooks;
  }

  RunningTimers Create(const Value& entries) {
    return CreatePeriodicEvents(Dictionary{{"periodicEvents", entries}}, monitor_, timers_, clock_);
  }

  testing::LogCapture capture_{4};
  FakeClock clock_;
  FakeTimers timers_{clock_};
  Monitor monitor_{Record(this)};
  std::vector<Fired> fired_;
};

TEST_F(PeriodicEventsTest, DailyTimersKeepTheirLocalHourAcrossClockChanges) {
  struct Case {
    const char* zone;
    const char* created;
    int startTime;
    std::vector<const char*> firings;
  };
  const Case cases[] = {
      // The first firing is always on the following day.
      {"Europe/Berlin", "2026-06-10 23:00:00 +0200", 90, {"2026-06-11 01:30:00 +0200"}},
      {"Europe/Berlin", "2026-06-11 00:30:00 +0200", 90, {"2026-06-12 01:30:00 +0200"}},
      {"Europe/Berlin", "2026-06-11 00:30:00 +0200", 0, {"2026-06-12 00:00:00 +0200"}},
      // Spring forward on 29 March, fall back on 25 October.
      {"Europe/Berlin",
       "2026-03-27 12:00:00 +0100",
       180,
       {"2026-03-28 03:00:00 +0100", "2026-03-29 03:00:00 +0200", "2026-03-30 03:00:00 +0200"}},
      {"Europe/Berlin", "2026-03-29 12:00:00 +0200", 0, {"2026-03-30 00:00:00 +0200"}},
      {"Europe/Berlin",
       "2026-10-24 12:00:00 +0200",
       180,
       {"2026-10-25 03:00:00 +0100", "2026-10-26 03:00:00 +0100"}},
      // 02:30 comes twice on 25 October; the timer fires once that day.
      {"Europe/Berlin",
       "2026-10-23 12:00:00 +0200",
       150,
       {"2026-10-24 02:30:00 +0200", "2026-10-25 02:30:00 +0200", "2026-10-26 02:30:00 +0100"}},
      {"America/New_York",
       "2026-03-07 12:00:00 -0500",
       90,
       {"2026-03-08 01:30:00 -0500", "2026-03-09 01:30:00 -0400"}},
      {"America/New_York",
       "2026-10-31 12:00:00 -0400",
       240,
       {"2026-11-01 04:00:00 -0500", "2026-11-02 04:00:00 -0500"}},
  };
  for (const Case& c : cases) {
    const ZoneScope zone(c.zone);
    clock_.advance(At(c.created) - clock_.now());
    fired_.clear();
    RunningTimers timers = Create(Value(plist::Array{
        Value(Dictionary{{"eventType", "daily"}, {"startTime", Value::Integer(c.startTime)}})}));
    timers_.advance(At(c.firings.back()) - clock_.now() + 1);
    std::vector<std::string> got;
    for (const Fired& f : fired_) got.push_back(Local(f.at));
    std::vector<std::string> want;
    for (const char* f : c.firings) want.push_back(Local(At(f)));
    EXPECT_EQ(got, want) << c.zone << " created " << c.created;
  }
}

TEST_F(PeriodicEventsTest, EntriesBecomeTimersOrAreRefusedByName) {
  EXPECT_TRUE(CreatePeriodicEvents(Dictionary(), monitor_, timers_, clock_).empty());
  EXPECT_TRUE(Create(Value(plist::Array())).empty());
  EXPECT_TRUE(testing::LinesInOrder(
      capture_.text(), {"No Periodic Events configured", "0 Periodic Events configured"}));
  RunningTimers timers = Create(Value(plist::Array{
      Value(Dictionary{{"eventType", "every.300"}, {"startInterval", Value::Integer(300)}}),
      Value(Dictionary{{"eventType", "interval.wins"},
                       {"startInterval", Value::Integer(60)},
                       {"startTime", Value::Integer(120)}}),
      Value(Dictionary{{"startInterval", Value::Integer(300)}}),  // no eventType
      Value(Dictionary{{"eventType", "zero"}, {"startInterval", Value::Integer(0)}}),
      Value(Dictionary{{"eventType", "negative"}, {"startInterval", Value::Real(-5)}}),
      Value(Dictionary{{"eventType", "words"}, {"startInterval", "often"}}),
      Value("not a dictionary"),
  }));
  EXPECT_EQ(timers.size(), 3u);
  const std::string log = capture_.text();
  for (const char* refused : {"entry 4 (zero) has startInterval 0", "entry 5 (negative)",
                              "entry 6 (words) has startInterval often", "entry 7 is not a"}) {
    EXPECT_NE(log.find(refused), std::string::npos) << refused;
  }
  EXPECT_NE(log.find("3 Periodic Events configured"), std::string::npos);

  timers_.advance(600);
  std::vector<std::pair<double, Dictionary>> got;
  for (const Fired& f : fired_) got.emplace_back(f.at, f.event);
  const Dictionary every{{"eventType", "every.300"}};
  const Dictionary wins{{"eventType", "interval.wins"}};
  ASSERT_EQ(got.size(), 14u);  // 10 of interval.wins, 2 of every.300, 2 without a type
  EXPECT_EQ(std::count(got.begin(), got.end(), std::make_pair(300.0, every)), 1);
  EXPECT_EQ(std::count(got.begin(), got.end(), std::make_pair(600.0, every)), 1);
  EXPECT_EQ(std::count(got.begin(), got.end(), std::make_pair(60.0, wins)), 1);
  EXPECT_EQ(std::count(got.begin(), got.end(), std::make_pair(300.0, Dictionary())), 1);

  CancelPeriodicEvents(timers);
  fired_.clear();
  timers_.advance(3600);
  EXPECT_TRUE(fired_.empty());
}

}  // namespace
}  // namespace tarvod
