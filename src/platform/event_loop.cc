#include "platform/event_loop.h"

#include <pthread.h>
#include <sys/eventfd.h>
#include <systemd/sd-event.h>
#include <unistd.h>

#include <condition_variable>
#include <future>

#include "platform/worker_thread.h"

namespace tarvod {
namespace {

int OnIo(sd_event_source*, int, uint32_t revents, void* userdata) {
  auto* handler = static_cast<std::function<void(uint32_t)>*>(userdata);
  (*handler)(revents);
  return 0;
}

int OnTimer(sd_event_source* source, uint64_t, void* userdata) {
  (*static_cast<std::function<void()>*>(userdata))();
  // A fired one-shot is freed now (its job with it), not kept by the loop until it ends:
  // dropping the loop's reference leaves only the one the dispatch holds until it returns.
  sd_event_source_set_floating(source, 0);
  return 0;
}

void DeleteTimerJob(void* userdata) { delete static_cast<std::function<void()>*>(userdata); }

}  // namespace

IoSource::IoSource(EventLoop& loop, bool gated, std::function<void(uint32_t)> handler)
    : mLoop(loop), mGated(gated), mHandler(std::move(handler)) {}

IoSource::~IoSource() {
  if (mGated) mLoop.mGatedSources.erase(this);
  sd_event_source_disable_unref(mSource);
}

void IoSource::setEnabled(bool enabled) {
  mEnabled = enabled;
  apply();
}

void IoSource::apply() {
  const bool on = mEnabled && (!mGated || mLoop.mGateOpen);
  sd_event_source_set_enabled(mSource, on ? SD_EVENT_ON : SD_EVENT_OFF);
}

EventLoop::EventLoop(std::string label) : mLabel(std::move(label)) {
  // The loop is created here so that ok() is known at once; sd-event binds an event object
  // to no thread until it runs, and it runs only on mThread from then on.
  mWakeFd = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (mWakeFd < 0 || sd_event_new(&mEvent) < 0) {
    mEvent = nullptr;
    return;
  }
  if (sd_event_add_io(
          mEvent, &mWakeSource, mWakeFd, EPOLLIN,
          [](sd_event_source*, int, uint32_t, void* self) {
            static_cast<EventLoop*>(self)->runPostedJobs();
            return 0;
          },
          this) < 0) {
    mEvent = sd_event_unref(mEvent);
    return;
  }
  mThread = StartWorkerThread([this] { run(); });
  std::string name = mLabel.size() > 15 ? mLabel.substr(mLabel.size() - 15) : mLabel;
  pthread_setname_np(mThread.native_handle(), name.c_str());
}

EventLoop::~EventLoop() {
  if (mThread.joinable()) {
    post([this] { sd_event_exit(mEvent, 0); });
    mThread.join();
    {
      std::lock_guard<std::mutex> lock(mLock);
      mStopping = true;
    }
    runPostedJobs();  // jobs posted after the exit request still run, in order
  }
  sd_event_source_disable_unref(mWakeSource);
  sd_event_unref(mEvent);
  if (mWakeFd >= 0) close(mWakeFd);
}

bool EventLoop::post(std::function<void()> job) {
  {
    std::lock_guard<std::mutex> lock(mLock);
    if (mStopping || mEvent == nullptr) return false;
    mJobs.push_back(std::move(job));
  }
  const uint64_t one = 1;
  // A full counter already means "wake up"; nothing else can go wrong with an eventfd.
  [[maybe_unused]] ssize_t written = write(mWakeFd, &one, sizeof one);
  return true;
}

void EventLoop::sync(const std::function<void()>& job) {
  if (isCurrentThread()) {
    job();
    return;
  }
  std::promise<void> done;
  std::future<void> finished = done.get_future();
  const bool posted = post([&] {
    job();
    done.set_value();
  });
  if (posted) finished.wait();
}

std::unique_ptr<IoSource> EventLoop::addIo(int fd, uint32_t events, bool gated,
                                           std::function<void(uint32_t)> handler) {
  if (mEvent == nullptr) return nullptr;
  std::unique_ptr<IoSource> source(new IoSource(*this, gated, std::move(handler)));
  if (sd_event_add_io(mEvent, &source->mSource, fd, events, OnIo, &source->mHandler) < 0) {
    return nullptr;
  }
  if (gated) mGatedSources.insert(source.get());
  source->apply();
  return source;
}

bool EventLoop::callLater(uint64_t delayMicroseconds, std::function<void()> job) {
  if (mEvent == nullptr) return false;
  auto* stored = new std::function<void()>(std::move(job));
  sd_event_source* source = nullptr;
  // An accuracy of 0 would mean sd-event's default of 250 ms, far coarser than the short
  // delays asked for here (the back-pressure poll): ask for microseconds.
  constexpr uint64_t kAccuracyMicroseconds = 1;
  if (sd_event_add_time_relative(mEvent, &source, CLOCK_MONOTONIC, delayMicroseconds,
                                 kAccuracyMicroseconds, OnTimer, stored) < 0) {
    delete stored;
    return false;
  }
  // The loop owns the one-shot source; the job is freed with it, fired or not.
  sd_event_source_set_destroy_callback(source, DeleteTimerJob);
  sd_event_source_set_floating(source, 1);
  sd_event_source_set_enabled(source, SD_EVENT_ONESHOT);
  sd_event_source_unref(source);
  return true;
}

void EventLoop::setReadGateOpen(bool open) {
  if (mGateOpen == open) return;
  mGateOpen = open;
  for (IoSource* source : mGatedSources) source->apply();
}

void EventLoop::run() { sd_event_loop(mEvent); }

void EventLoop::runPostedJobs() {
  uint64_t count;
  [[maybe_unused]] ssize_t got = read(mWakeFd, &count, sizeof count);
  std::deque<std::function<void()>> jobs;
  {
    std::lock_guard<std::mutex> lock(mLock);
    jobs.swap(mJobs);
  }
  for (auto& job : jobs) {
    job();
    job = nullptr;
  }
}

}  // namespace tarvod
