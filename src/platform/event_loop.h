// A serial queue whose one thread runs an sd-event loop, so that descriptors (sockets, the
// audit pipe) are watched on the same thread that runs the queue's jobs. post and sync may be
// called from any thread; sources are created, changed and destroyed on the loop thread only.
#pragma once

#include <sys/epoll.h>

#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>

struct sd_event;
struct sd_event_source;

namespace tarvod {

class EventLoop;

// One watched descriptor. Destroying it stops the watch (the descriptor stays open: it belongs
// to whoever opened it). It must not be destroyed from inside its own handler; post the
// destruction instead.
class IoSource {
 public:
  ~IoSource();
  IoSource(const IoSource&) = delete;
  IoSource& operator=(const IoSource&) = delete;

  // Whether the owner wants events; the loop's read gate can still hold a gated source off.
  void setEnabled(bool enabled);

 private:
  friend class EventLoop;
  IoSource(EventLoop& loop, bool gated, std::function<void(uint32_t)> handler);
  void apply();

  EventLoop& mLoop;
  const bool mGated;
  bool mEnabled = true;
  sd_event_source* mSource = nullptr;
  std::function<void(uint32_t)> mHandler;
};

class EventLoop {
 public:
  // Starts the thread. ok() is false when the sd-event loop could not be created; the queue
  // then runs no jobs and every source creation fails.
  explicit EventLoop(std::string label);
  // Stops the loop, runs the jobs still queued, joins the thread.
  ~EventLoop();
  EventLoop(const EventLoop&) = delete;
  EventLoop& operator=(const EventLoop&) = delete;

  bool ok() const { return mEvent != nullptr; }
  const std::string& label() const { return mLabel; }
  bool isCurrentThread() const { return std::this_thread::get_id() == mThread.get_id(); }

  // False (and the job dropped) once the loop is stopping or was never created.
  bool post(std::function<void()> job);
  // Runs job on the loop after every job posted before it and waits for it; on the loop's
  // own thread it runs at once.
  void sync(const std::function<void()>& job);

  // Loop thread only. Watches fd for the epoll events; the handler gets the events that
  // fired. A gated source is held off while the read gate is closed. nullptr on failure.
  std::unique_ptr<IoSource> addIo(int fd, uint32_t events, bool gated,
                                  std::function<void(uint32_t)> handler);
  // Loop thread only. Runs job once, after delay microseconds. False on failure.
  bool callLater(uint64_t delayMicroseconds, std::function<void()> job);
  // Loop thread only. Closing the gate stops every gated source until it is opened again.
  void setReadGateOpen(bool open);
  bool readGateOpen() const { return mGateOpen; }

 private:
  friend class IoSource;
  void run();
  void runPostedJobs();

  const std::string mLabel;
  sd_event* mEvent = nullptr;
  int mWakeFd = -1;
  sd_event_source* mWakeSource = nullptr;

  std::mutex mLock;
  std::deque<std::function<void()>> mJobs;
  bool mStopping = false;

  bool mGateOpen = true;
  std::set<IoSource*> mGatedSources;
  std::thread mThread;
};

}  // namespace tarvod
