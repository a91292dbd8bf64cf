#include "platform/serial_queue.h"

#include <gtest/gtest.h>

#include <atomic>
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
