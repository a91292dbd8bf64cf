// Monotonic time for code that measures intervals, so that tests can move time by hand instead
// of sleeping. now() may be called from any thread.
#pragma once

namespace tarvod {

class Clock {
 public:
  virtual ~Clock() = default;
  // Seconds since an arbitrary fixed point; never goes backwards.
  virtual double now() = 0;
};

// The host's monotonic clock (CLOCK_MONOTONIC). Lives for the life of the process.
Clock& MonotonicClock();

}  // namespace tarvod
