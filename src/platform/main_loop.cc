#include "platform/main_loop.h"

#include <systemd/sd-daemon.h>
#include <systemd/sd-event.h>
#include <unistd.h>

namespace tarvod {

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

void NotifyServiceManager(const char* state) { sd_notify(0, state); }

}  // namespace tarvod
