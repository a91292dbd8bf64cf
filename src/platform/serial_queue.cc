#include "platform/serial_queue.h"

#include <pthread.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <chrono>

#include "platform/worker_thread.h"

namespace tarvod {
namespace {

thread_local SerialQueue* tCurrentQueue = nullptr;

void Signal(int fd) {
  const uint64_t one = 1;
  [[maybe_unused]] ssize_t n = write(fd, &one, sizeof one);
}

}  // namespace

SerialQueue::SerialQueue(std::string label) : mLabel(std::move(label)) {
  mProgressFd = eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
  mThread = StartWorkerThread([this] {
    tCurrentQueue = this;
    run();
  });
  // Thread names are limited to 15 bytes; the tail of the label is the telling part.
  std::string name = mLabel.size() > 15 ? mLabel.substr(mLabel.size() - 15) : mLabel;
  pthread_setname_np(mThread.native_handle(), name.c_str());
}

SerialQueue::~SerialQueue() {
  {
    std::lock_guard<std::mutex> lock(mLock);
    mStopping = true;
  }
  mWorkAvailable.notify_all();
  if (mThread.joinable()) mThread.join();
  if (mProgressFd >= 0) close(mProgressFd);
}

void SerialQueue::async(std::function<void()> job) {
  {
    std::lock_guard<std::mutex> lock(mLock);
    if (mAbandoned) return;
    mJobs.push_back(std::move(job));
    if (++mPending > mHighWater) mHighWater = mPending;
  }
  mWorkAvailable.notify_one();
}

void SerialQueue::sync(const std::function<void()>& job) {
  if (isCurrentThread()) {
    job();
    return;
  }
  std::mutex doneLock;
  std::condition_variable doneSignal;
  bool done = false;
  {
    std::lock_guard<std::mutex> lock(mLock);
    if (mAbandoned) return;
  }
  async([&] {
    job();
    if (mIdleHandler) mIdleHandler();
    std::lock_guard<std::mutex> lock(doneLock);
    done = true;
    doneSignal.notify_one();
  });
  std::unique_lock<std::mutex> lock(doneLock);
  doneSignal.wait(lock, [&] { return done; });
}

bool SerialQueue::drainFor(double seconds) {
  std::unique_lock<std::mutex> lock(mLock);
  return mProgress.wait_for(lock, std::chrono::duration<double>(seconds),
                            [&] { return mPending == 0; });
}

size_t SerialQueue::highWater() const {
  std::lock_guard<std::mutex> lock(mLock);
  return mHighWater;
}

size_t SerialQueue::pending() const {
  std::lock_guard<std::mutex> lock(mLock);
  return mPending;
}

void SerialQueue::waitUntilPendingAtMost(size_t limit) {
  std::unique_lock<std::mutex> lock(mLock);
  mProgress.wait(lock, [&] { return mPending <= limit; });
}

void SerialQueue::signalWhenPendingAtMost(size_t limit) {
  std::lock_guard<std::mutex> lock(mLock);
  if (mPending <= limit) {
    Signal(mProgressFd);
    return;
  }
  mSignalLimit = limit;
  mSignalArmed = true;
}

bool SerialQueue::runExclusive(const std::function<void()>& work, double seconds) {
  if (isCurrentThread()) {
    work();
    return true;
  }
  {
    std::unique_lock<std::mutex> lock(mLock);
    if (!mJobGate.wait_for(lock, std::chrono::duration<double>(seconds),
                           [&] { return !mJobActive && !mExclusive; })) {
      return false;
    }
    mExclusive = true;
  }
  work();
  {
    std::lock_guard<std::mutex> lock(mLock);
    mExclusive = false;
  }
  mJobGate.notify_all();
  return true;
}

size_t SerialQueue::abandon() {
  std::lock_guard<std::mutex> lock(mLock);
  const size_t dropped = mJobs.size();
  mJobs.clear();
  mPending -= dropped;
  mAbandoned = true;
  mProgress.notify_all();
  return dropped;
}

bool SerialQueue::abandoned() const {
  std::lock_guard<std::mutex> lock(mLock);
  return mAbandoned;
}

SerialQueue::BlockingSection::BlockingSection() : mQueue(tCurrentQueue) {
  if (!mQueue) return;
  {
    std::lock_guard<std::mutex> lock(mQueue->mLock);
    mQueue->mJobActive = false;
  }
  mQueue->mJobGate.notify_all();
}

SerialQueue::BlockingSection::~BlockingSection() {
  if (!mQueue) return;
  std::unique_lock<std::mutex> lock(mQueue->mLock);
  mQueue->mJobGate.wait(lock, [&] { return !mQueue->mExclusive; });
  mQueue->mJobActive = true;
}

void SerialQueue::run() {
  std::unique_lock<std::mutex> lock(mLock);
  for (;;) {
    mWorkAvailable.wait(lock, [&] { return mStopping || !mJobs.empty(); });
    if (mJobs.empty()) return;  // stopping, and everything submitted has run
    std::function<void()> job = std::move(mJobs.front());
    mJobs.pop_front();
    mJobGate.wait(lock, [&] { return !mExclusive; });
    mJobActive = true;
    lock.unlock();
    job();
    job = nullptr;  // release what the job captured before reporting progress
    lock.lock();
    if (mJobs.empty() && mIdleHandler) {
      lock.unlock();
      mIdleHandler();
      lock.lock();
    }
    mJobActive = false;
    mJobGate.notify_all();
    --mPending;
    if (mSignalArmed && mPending <= mSignalLimit) {
      mSignalArmed = false;
      Signal(mProgressFd);
    }
    mProgress.notify_all();
  }
}

}  // namespace tarvod
