#include "platform/serial_queue.h"

#include <pthread.h>

namespace tarvod {

SerialQueue::SerialQueue(std::string label) : mLabel(std::move(label)) {
  mThread = std::thread([this] { run(); });
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
}

void SerialQueue::async(std::function<void()> job) {
  {
    std::lock_guard<std::mutex> lock(mLock);
    mJobs.push_back(std::move(job));
    ++mPending;
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
  async([&] {
    job();
    std::lock_guard<std::mutex> lock(doneLock);
    done = true;
    doneSignal.notify_one();
  });
  std::unique_lock<std::mutex> lock(doneLock);
  doneSignal.wait(lock, [&] { return done; });
}

size_t SerialQueue::pending() const {
  std::lock_guard<std::mutex> lock(mLock);
  return mPending;
}

void SerialQueue::waitUntilPendingAtMost(size_t limit) {
  std::unique_lock<std::mutex> lock(mLock);
  mProgress.wait(lock, [&] { return mPending <= limit; });
}

void SerialQueue::run() {
  std::unique_lock<std::mutex> lock(mLock);
  for (;;) {
    mWorkAvailable.wait(lock, [&] { return mStopping || !mJobs.empty(); });
    if (mJobs.empty()) return;  // stopping, and everything submitted has run
    std::function<void()> job = std::move(mJobs.front());
    mJobs.pop_front();
    lock.unlock();
    job();
    job = nullptr;  // release what the job captured before reporting progress
    lock.lock();
    --mPending;
    mProgress.notify_all();
  }
}

}  // namespace tarvod
