// The main thread's run loop: an sd-event loop run in bounded slices, woken early by a
// descriptor (the signal handlers' eventfd). Main thread only.
#pragma once

#include <cstdint>
#include <functional>

struct sd_event;
struct sd_event_source;

namespace tarvod {

class MainLoop {
 public:
  MainLoop();
  ~MainLoop();
  MainLoop(const MainLoop&) = delete;
  MainLoop& operator=(const MainLoop&) = delete;

  // Calls onReadable whenever fd becomes readable; the callback empties it.
  void watch(int fd, std::function<void()> onReadable);
  // Runs one slice: returns after handling what was ready or when microseconds have passed.
  // False when the loop cannot run at all (it then sleeps out the slice).
  bool runSlice(uint64_t microseconds);

 private:
  sd_event* mEvent = nullptr;
  sd_event_source* mWatch = nullptr;
  std::function<void()> mOnReadable;
};

// Tells the service manager about the daemon's state ("READY=1", "RELOADING=1",
// "STOPPING=1"); nothing happens when it does not listen (no NOTIFY_SOCKET).
void NotifyServiceManager(const char* state);

}  // namespace tarvod
