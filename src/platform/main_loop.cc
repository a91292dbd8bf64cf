#include "platform/main_loop.h"

#include <systemd/sd-daemon.h>
#include <systemd/sd-event.h>
#include <time.h>
#include <unistd.h>

#include <cmath>

#include "plist/value.h"

namespace tarvod {
namespace {

// Timers wake within a millisecond of their instant; sd-event's default slack is 250 ms.
constexpr uint64_t kTimerAccuracyMicroseconds = 1000;
// Periods and instants are clamped to about 3000 years, far inside uint64_t microseconds.
constexpr double kLongestMicroseconds = 1e17;

uint64_t Microseconds(double seconds) {
  if (!(seconds > 0)) return 0;
  return static_cast<uint64_t>(std::min(seconds * 1e6, kLongestMicroseconds));
}

class LoopTimer final : public TimerHandle {
 public:
  ~LoopTimer() override { sd_event_source_disable_unref(mSource); }

  // Interval timers: the next instant on the schedule after now.
  static int OnInterval(sd_event_source* source, uint64_t due, void* data) {
    auto* timer = static_cast<LoopTimer*>(data);
    uint64_t now = due;
    sd_event_now(sd_event_source_get_event(source), CLOCK_MONOTONIC, &now);
    const uint64_t period = timer->mPeriod;
    const uint64_t missed = now > due ? (now - due) / period : 0;
    sd_event_source_set_time(source, due + (missed + 1) * period);
    timer->mFire();
    return 0;
  }

  static int OnWallClock(sd_event_source* source, uint64_t, void* data) {
    auto* timer = static_cast<LoopTimer*>(data);
    const double next = timer->mFireWallClock();
    sd_event_source_set_time(source, Microseconds(next + plist::kUnixTimeOfReferenceDate));
    return 0;
  }

  sd_event_source* mSource = nullptr;
  uint64_t mPeriod = 1;
  std::function<void()> mFire;
  std::function<double()> mFireWallClock;
};

}  // namespace

MainLoop::MainLoop() { sd_event_default(&mEvent); }

MainLoop::~MainLoop() {
  sd_event_source_unref(mWatch);
  sd_event_unref(mEvent);
}

void MainLoop::watch(int fd, std::function<void()> onReadable) {
  mOnReadable = std::move(onReadable);
  if (!mEvent || fd < 0) return;
  sd_event_add_io(
      mEvent, &mWatch, fd, EPOLLIN,
      [](sd_event_source*, int, uint32_t, void* self) {
        static_cast<MainLoop*>(self)->mOnReadable();
        return 0;
      },
      this);
}

bool MainLoop::runSlice(uint64_t microseconds) {
  if (!mEvent || sd_event_run(mEvent, microseconds) < 0) {
    usleep(static_cast<useconds_t>(microseconds));  // still honour requests once per slice
    return mEvent != nullptr;
  }
  return true;
}

std::unique_ptr<TimerHandle> MainLoop::repeating(double period, std::function<void()> fire) {
  if (!mEvent || !(period > 0)) return nullptr;
  auto timer = std::make_unique<LoopTimer>();
  timer->mPeriod = std::max<uint64_t>(1, Microseconds(period));
  timer->mFire = std::move(fire);
  uint64_t now = 0;
  if (sd_event_now(mEvent, CLOCK_MONOTONIC, &now) < 0 ||
      sd_event_add_time(mEvent, &timer->mSource, CLOCK_MONOTONIC, now + timer->mPeriod,
                        kTimerAccuracyMicroseconds, LoopTimer::OnInterval, timer.get()) < 0 ||
      sd_event_source_set_enabled(timer->mSource, SD_EVENT_ON) < 0) {
    return nullptr;
  }
  return timer;
}

std::unique_ptr<TimerHandle> MainLoop::wallClock(double first, std::function<double()> fire) {
  if (!mEvent || !std::isfinite(first)) return nullptr;
  auto timer = std::make_unique<LoopTimer>();
  timer->mFireWallClock = std::move(fire);
  if (sd_event_add_time(mEvent, &timer->mSource, CLOCK_REALTIME,
                        Microseconds(first + plist::kUnixTimeOfReferenceDate),
                        kTimerAccuracyMicroseconds, LoopTimer::OnWallClock, timer.get()) < 0 ||
      sd_event_source_set_enabled(timer->mSource, SD_EVENT_ON) < 0) {
    return nullptr;
  }
  return timer;
}

void NotifyServiceManager(const char* state) { sd_notify(0, state); }

}  // namespace tarvod
