// Test support: Monitor hooks that collect dispatched events, and an event socket client.
// Test-only; the collector may be filled from the input queue while the test thread waits.
#pragma once

#include <sys/eventfd.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/seqpacket.h"
#include "sources/monitor.h"

namespace tarvod::testing {

class EventCollector {
 public:
  EventCollector() : mProgressFd(eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC)) {}
  ~EventCollector() { close(mProgressFd); }

  // Dispatch into this collector; with backPressure, the backlog is the one setBacklog sets.
  MonitorHooks hooks(bool backPressure = false) {
    MonitorHooks h;
    h.dispatch = [this](const plist::Dictionary& event) {
      std::lock_guard<std::mutex> lock(mLock);
      mEvents.push_back(event);
      mChanged.notify_all();
    };
    if (backPressure) {
      h.backlog = [this] { return mBacklog.load(); };
      h.signalWhenBacklogAtMost = [this](size_t limit) {
        mSignalLimit = limit;
        signalIfDue();
      };
      h.progressDescriptor = mProgressFd;
    }
    return h;
  }
  // The pretended processing backlog; signals progress the way the processing queue does.
  void setBacklog(size_t backlog) {
    mBacklog = backlog;
    signalIfDue();
  }
  bool waitFor(size_t count, std::chrono::seconds timeout = std::chrono::seconds(10)) {
    std::unique_lock<std::mutex> lock(mLock);
    return mChanged.wait_for(lock, timeout, [&] { return mEvents.size() >= count; });
  }
  std::vector<plist::Dictionary> events() {
    std::lock_guard<std::mutex> lock(mLock);
    return mEvents;
  }
  size_t size() {
    std::lock_guard<std::mutex> lock(mLock);
    return mEvents.size();
  }

  size_t backlogSignalLimit() const { return mSignalLimit; }

 private:
  void signalIfDue() {
    const size_t limit = mSignalLimit.load();
    if (limit != kNoLimit && mBacklog.load() <= limit) {
      mSignalLimit = kNoLimit;
      const uint64_t one = 1;
      [[maybe_unused]] ssize_t n = write(mProgressFd, &one, sizeof one);
    }
  }
  static constexpr size_t kNoLimit = ~size_t{0};
  int mProgressFd;
  std::atomic<size_t> mBacklog{0};
  std::atomic<size_t> mSignalLimit{kNoLimit};
  std::mutex mLock;
  std::condition_variable mChanged;
  std::vector<plist::Dictionary> mEvents;
};

inline std::string XmlPlist(std::string_view body) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">" + std::string(body) +
         "</plist>\n";
}
inline std::string EventXml(std::string_view type, std::string_view extra = {}) {
  return XmlPlist("<dict><key>eventType</key><string>" + std::string(type) + "</string>" +
                  std::string(extra) + "</dict>");
}

// A connected client; closes on destruction.
class Client {
 public:
  explicit Client(const std::string& path) : mFd(ConnectSeqpacket(path).fd) {}
  ~Client() {
    if (mFd >= 0) close(mFd);
  }
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;
  bool connected() const { return mFd >= 0; }
  bool send(std::string_view bytes) {
    std::string error;
    return mFd >= 0 && SendPacket(mFd, bytes, &error);
  }
  int fd() const { return mFd; }

 private:
  int mFd;
};

}  // namespace tarvod::testing
