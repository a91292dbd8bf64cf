// A clock that tests move by hand.
#pragma once

#include <atomic>

#include "platform/clock.h"

namespace tarvod {

class FakeClock final : public Clock {
 public:
  explicit FakeClock(double now = 0) : mNow(now) {}
  double now() const override { return mNow.load(); }
  double monotonic() const override { return mNow.load(); }
  void advance(double seconds) { mNow.store(mNow.load() + seconds); }

 private:
  std::atomic<double> mNow;
};

}  // namespace tarvod
