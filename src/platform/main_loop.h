// The main thread's run loop: an sd-event loop run in bounded slices, woken early by a
// descriptor (the signal handlers' eventfd); it carries the periodic timers and the
// notification bus connection. Main thread only.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>

#include "platform/timers.h"

struct sd_event;
struct sd_event_source;

namespace tarvod {

class MainLoop final : public Timers {
 public:
  MainLoop();
  ~MainLoop() override;
  MainLoop(const MainLoop&) = delete;
  MainLoop& operator=(const MainLoop&) = delete;

  // Calls onReadable whenever fd becomes readable; the callback empties it.
  void watch(int fd, std::function<void()> onReadable);
  // Runs one slice: returns after handling what was ready or when microseconds have passed.
  // False when the loop cannot run at all (it then sleeps out the slice).
  bool runSlice(uint64_t microseconds);
  // The sd-event loop, for sources attached by other platform units (the bus); nullptr when
  // it could not be created.
  sd_event* event() const { return mEvent; }

  std::unique_ptr<TimerHandle> repeating(double period, std::function<void()> fire) override;
  std::unique_ptr<TimerHandle> wallClock(double first, std::function<double()> fire) override;

 private:
  sd_event* mEvent = nullptr;
  sd_event_source* mWatch = nullptr;
  std::function<void()> mOnReadable;
};

// Tells the service manager about the daemon's state ("READY=1", "RELOADING=1",
// "STOPPING=1"); nothing happens when it does not listen (no NOTIFY_SOCKET).
void NotifyServiceManager(const char* state);

}  // namespace tarvod
