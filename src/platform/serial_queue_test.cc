#include "platform/serial_queue.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>

#include <atomic>
#include <mutex>
#include <thread>
#include <vector>

namespace tarvod {
namespace {

TEST(SerialQueue, RunsJobsOneAtATimeInSubmissionOrderFromManyThreads) {
  SerialQueue queue("test.order");
  std::atomic<int> running{0};
  std::atomic<bool> overlapped{false};
  std::vector<int> seen;  // written only by queue jobs: TSan flags any concurrent run
  std::vector<std::thread> submitters;
  for (int t = 0; t < 4; ++t) {
    submitters.emplace_back([&, t] {
      for (int i = 0; i < 500; ++i) {
        queue.async([&, t, i] {
          if (running.fetch_add(1) != 0) overlapped = true;
          seen.push_back(t * 1000 + i);
          running.fetch_sub(1);
        });
      }
    });
  }
  for (auto& s : submitters) s.join();
  queue.drain();
  EXPECT_FALSE(overlapped);
  ASSERT_EQ(seen.size(), 2000u);
  // Each submitter's jobs keep their relative order.
  std::vector<int> last(4, -1);
  for (int v : seen) {
    EXPECT_GT(v % 1000, last[v / 1000]);
    last[v / 1000] = v % 1000;
  }
}

// The idle handler runs once the queue has run out of jobs, and before a sync job's waiter or
// a drain returns, so that work held back until then (batched records) is visible to them.
TEST(SerialQueue, RunsTheIdleHandlerWhenEmptyAndBeforeWaitsReturn) {
  SerialQueue queue("test.idle");
  std::atomic<int> jobsDone{0};
  std::atomic<int> jobsAtFirstIdle{-1};
  std::atomic<int> idles{0};
  std::atomic<bool> syncRan{false};
  std::atomic<bool> idleAfterSync{false};
  queue.setIdleHandler([&] {
    int unset = -1;
    jobsAtFirstIdle.compare_exchange_strong(unset, jobsDone.load());
    if (syncRan) idleAfterSync = true;
    ++idles;
  });
  std::mutex gate;
  gate.lock();
  queue.async([&] {
    std::lock_guard<std::mutex> wait(gate);  // holds the queue until all three are in
    ++jobsDone;
  });
  queue.async([&] { ++jobsDone; });
  queue.async([&] { ++jobsDone; });
  gate.unlock();
  queue.sync([&] { syncRan = true; });
  EXPECT_TRUE(idleAfterSync);
  EXPECT_EQ(jobsAtFirstIdle, 3);
  EXPECT_TRUE(queue.drainFor(5.0));
  const int before = idles;
  queue.async([&] { ++jobsDone; });
  EXPECT_TRUE(queue.drainFor(5.0));  // returns once the idle handler has run too
  EXPECT_EQ(idles, before + 1);
}

// The process's stop and reload signals go to the main thread, never to a queue's.
TEST(SerialQueue, ItsThreadBlocksTheSignalsThatSteerTheProcessAndLeavesTheCallersMask) {
  SerialQueue queue("test.signals");
  sigset_t inQueue;
  queue.sync([&] { pthread_sigmask(SIG_BLOCK, nullptr, &inQueue); });
  for (const int signal : {SIGTERM, SIGINT, SIGHUP, SIGUSR1}) {
    EXPECT_TRUE(sigismember(&inQueue, signal)) << signal;
  }
  sigset_t here;
  pthread_sigmask(SIG_BLOCK, nullptr, &here);
  EXPECT_FALSE(sigismember(&here, SIGTERM));
}

TEST(SerialQueue, SyncFromTheQueueItselfRunsInline) {
  SerialQueue queue("test.inline");
  bool inner = false;
  queue.sync([&] { queue.sync([&] { inner = true; }); });
  EXPECT_TRUE(inner);
}

TEST(SerialQueue, DestructionRunsEverySubmittedJob) {
  std::atomic<int> ran{0};
  {
    SerialQueue queue("test.destroy");
    for (int i = 0; i < 100; ++i) queue.async([&] { ran++; });
  }
  EXPECT_EQ(ran.load(), 100);
}

TEST(SerialQueue, PendingCountsUnfinishedJobsAndWaitingReleasesWhenTheyDrain) {
  SerialQueue queue("test.pending");
  std::atomic<bool> release{false};
  queue.async([&] {
    while (!release) std::this_thread::yield();
  });
  for (int i = 0; i < 9; ++i) queue.async([] {});
  EXPECT_EQ(queue.pending(), 10u);
  std::thread waiter([&] { queue.waitUntilPendingAtMost(0); });
  release = true;
  waiter.join();
  EXPECT_EQ(queue.pending(), 0u);
}

}  // namespace
}  // namespace tarvod
