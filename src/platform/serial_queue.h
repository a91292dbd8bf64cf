// A serial dispatch queue: one worker thread runs submitted jobs one at a time, in submission
// order. async and sync may be called from any thread; sync called from the queue's own
// thread runs the job at once (it would otherwise wait for itself).
#pragma once

#include <condition_variable>
#include <cstddef>
#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <thread>

namespace tarvod {

class SerialQueue {
 public:
  explicit SerialQueue(std::string label);
  // Runs every job already submitted, then joins the worker.
  ~SerialQueue();
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  const std::string& label() const { return mLabel; }

  void async(std::function<void()> job);
  // Runs job on the queue after every job submitted before it, and waits for it.
  void sync(const std::function<void()>& job);
  // Waits until every job submitted so far has run.
  void drain() {
    sync([] {});
  }

  // Jobs submitted and not yet finished (the one running included).
  size_t pending() const;
  // Blocks the caller until at most limit jobs are pending.
  void waitUntilPendingAtMost(size_t limit);
  bool isCurrentThread() const { return std::this_thread::get_id() == mThread.get_id(); }

 private:
  void run();

  const std::string mLabel;
  mutable std::mutex mLock;
  std::condition_variable mWorkAvailable;
  std::condition_variable mProgress;
  std::deque<std::function<void()>> mJobs;
  size_t mPending = 0;
  bool mStopping = false;
  std::thread mThread;
};

}  // namespace tarvod
