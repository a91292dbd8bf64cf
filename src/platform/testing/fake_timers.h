// Timers that fire only when a test moves the fake clock. The clock's one time axis serves
// both the monotonic and the wall-clock timers. Test thread only.
#pragma once

#include <algorithm>
#include <memory>
#include <optional>
#include <vector>

#include "platform/testing/fake_clock.h"
#include "platform/timers.h"

namespace tarvod {

class FakeTimers final : public Timers {
 public:
  explicit FakeTimers(FakeClock& clock) : mClock(clock) {}

  std::unique_ptr<TimerHandle> repeating(double period, std::function<void()> fire) override {
    auto entry = std::make_shared<Entry>();
    entry->period = period;
    entry->due = mClock.now() + period;
    entry->fire = std::move(fire);
    return add(entry);
  }
  std::unique_ptr<TimerHandle> wallClock(double first, std::function<double()> fire) override {
    auto entry = std::make_shared<Entry>();
    entry->due = first;
    entry->fireWallClock = std::move(fire);
    return add(entry);
  }

  // The instants the live timers fire at next, in the order they were created.
  std::vector<double> dueTimes() const {
    std::vector<double> times;
    for (const auto& entry : mEntries) {
      if (entry->alive) times.push_back(entry->due);
    }
    return times;
  }

  // Moves the clock forward, firing each timer that falls due on the way, earliest first.
  void advance(double seconds) {
    const double target = mClock.now() + seconds;
    for (;;) {
      std::shared_ptr<Entry> next;
      for (const auto& entry : mEntries) {
        if (entry->alive && entry->due <= target && (!next || entry->due < next->due)) {
          next = entry;
        }
      }
      if (!next) break;
      mClock.advance(std::max(0.0, next->due - mClock.now()));
      if (next->fireWallClock) {
        next->due = next->fireWallClock();
      } else {
        next->due += next->period;
        next->fire();
      }
    }
    mClock.advance(target - mClock.now());
  }

 private:
  struct Entry {
    bool alive = true;
    double due = 0;
    double period = 0;
    std::function<void()> fire;
    std::function<double()> fireWallClock;
  };
  class Handle final : public TimerHandle {
   public:
    explicit Handle(std::shared_ptr<Entry> entry) : mEntry(std::move(entry)) {}
    ~Handle() override { mEntry->alive = false; }

   private:
    std::shared_ptr<Entry> mEntry;
  };

  std::unique_ptr<TimerHandle> add(const std::shared_ptr<Entry>& entry) {
    mEntries.push_back(entry);
    return std::make_unique<Handle>(entry);
  }

  FakeClock& mClock;
  std::vector<std::shared_ptr<Entry>> mEntries;
};

}  // namespace tarvod
