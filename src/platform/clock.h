// The clock: wall time for timestamps and dates, monotonic time for deadlines. The system
// clock may be used from any thread; tests pass a FakeClock (src/platform/testing).
#pragma once

#include <cstdint>
#include <string>

namespace tarvod {

class Clock {
 public:
  virtual ~Clock() = default;
  // Seconds since 2001-01-01 00:00:00 UTC, the reference date of every timestamp.
  virtual double now() const = 0;
  // Seconds on a clock that never goes back; only differences mean anything.
  virtual double monotonic() const = 0;

  // The host's clock; lives as long as the process.
  static Clock& System();
};

// The local date and time of now() in the calendar-date text form of the start and stop
// messages: "2026-12-06 13:14:03 +0100".
std::string LocalDateText(const Clock& clock);

// Local calendar arithmetic in the process's time zone (TZ). The instant, in seconds since
// 2001, of local midnight on the day `days` after the calendar day of `instant`, plus
// `minutes` minutes of local wall-clock time: minutes beyond a day run into the next days,
// and a time that a clock change skips falls after the gap.
double LocalDayTime(double instant, int days, int64_t minutes);

}  // namespace tarvod
