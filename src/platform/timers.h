// Repeating timers on the main thread's loop: interval timers on the monotonic clock and
// wall-clock timers whose next instant the owner computes at each firing (daily timers in
// local time). Main thread only; MainLoop is the real facility, FakeTimers
// (src/platform/testing) the one tests move by hand.
#pragma once

#include <functional>
#include <memory>

namespace tarvod {

// A scheduled timer. Destroying the handle cancels it: it never fires again. A timer's own
// callback must not destroy its handle.
class TimerHandle {
 public:
  virtual ~TimerHandle() = default;
};

class Timers {
 public:
  virtual ~Timers() = default;
  // Calls fire every period seconds (period > 0) of the monotonic clock, the first time one
  // period from now. A timer that falls behind fires once and keeps its schedule, without
  // catching up on the firings it missed. nullptr when the timer cannot be created.
  virtual std::unique_ptr<TimerHandle> repeating(double period, std::function<void()> fire) = 0;
  // Calls fire at the wall-clock instant first (seconds since 2001-01-01 UTC), then at each
  // instant fire returns. An instant already past fires at once. nullptr on failure.
  virtual std::unique_ptr<TimerHandle> wallClock(double first, std::function<double()> fire) = 0;
};

}  // namespace tarvod
