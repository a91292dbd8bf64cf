// A serial dispatch queue: one worker thread runs submitted jobs one at a time, in submission
// order. async, sync and the waits may be called from any thread; sync called from the
// queue's own thread runs the job at once (it would otherwise wait for itself).
//
// A job holds the queue's job lock while it runs, except inside a BlockingSection, which a
// job opens around a call that may block for long (a write, a wait for a child). Another
// thread can then still run work exclusive of the jobs with runExclusive: the one way to
// reach the queue's data while a job is stuck.
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
  // Runs every job already submitted, then joins the worker. Must not be called while a job
  // is stuck; see abandon.
  ~SerialQueue();
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  const std::string& label() const { return mLabel; }

  // Runs on the queue's thread whenever it runs out of jobs, and after every sync job, before
  // the waits for that job return: work held back until the queue is idle (records written
  // in batches) is done before anyone who waits for the queue looks. Set before the first job.
  void setIdleHandler(std::function<void()> handler) { mIdleHandler = std::move(handler); }

  void async(std::function<void()> job);
  // Runs job on the queue after every job submitted before it, and waits for it.
  void sync(const std::function<void()>& job);
  // Waits until every job submitted so far has run.
  void drain() {
    sync([] {});
  }
  // Waits until no job is pending or the monotonic deadline (seconds, steady clock) passes;
  // true when the queue ran empty.
  bool drainFor(double seconds);

  // Jobs submitted and not yet finished (the one running included).
  size_t pending() const;
  // The most jobs ever pending at once.
  size_t highWater() const;
  // Blocks the caller until at most limit jobs are pending.
  void waitUntilPendingAtMost(size_t limit);
  // A non-blocking eventfd that becomes readable once at most limit jobs are pending, after
  // signalWhenPendingAtMost(limit) asked for it. The reader empties it.
  int progressDescriptor() const { return mProgressFd; }
  void signalWhenPendingAtMost(size_t limit);

  // Runs work on the calling thread while no job holds the job lock; false when that did not
  // happen within seconds.
  bool runExclusive(const std::function<void()>& work, double seconds);
  // Drops every job not yet started and refuses new ones; returns how many were dropped.
  // A job already running finishes (or stays stuck) on its own.
  size_t abandon();
  // True once abandoned: a long job stops between its steps, as the jobs after it were.
  bool abandoned() const;

  bool isCurrentThread() const { return std::this_thread::get_id() == mThread.get_id(); }

  // Releases the running job's lock for the section's lifetime; a no-op off a queue thread.
  class BlockingSection {
   public:
    BlockingSection();
    ~BlockingSection();
    BlockingSection(const BlockingSection&) = delete;
    BlockingSection& operator=(const BlockingSection&) = delete;

   private:
    SerialQueue* mQueue;
  };

 private:
  void run();

  const std::string mLabel;
  mutable std::mutex mLock;
  std::condition_variable mWorkAvailable;
  std::condition_variable mProgress;
  std::deque<std::function<void()>> mJobs;
  std::function<void()> mIdleHandler;
  size_t mPending = 0;
  size_t mHighWater = 0;
  bool mStopping = false;
  bool mAbandoned = false;
  size_t mSignalLimit = 0;
  bool mSignalArmed = false;
  int mProgressFd = -1;
  // The job lock, kept under mLock with a condition variable rather than as a timed mutex
  // (whose timed lock ThreadSanitizer cannot follow): a job holds it while it runs outside a
  // blocking section; runExclusive holds it while its work runs.
  std::condition_variable mJobGate;
  bool mJobActive = false;
  bool mExclusive = false;
  std::thread mThread;
};

}  // namespace tarvod
