// A notification center in memory: posts are recorded; receive plays a notification from
// another process, held while suspended. Test thread only (post may come from the
// processing queue's thread; it takes a lock).
#pragma once

#include <deque>
#include <map>
#include <mutex>
#include <vector>

#include "platform/notification_center.h"

namespace tarvod {

class FakeNotificationCenter final : public NotificationCenter {
 public:
  Status attach(MainLoop&) override { return Status::Ok(); }
  Status addObserver(const void* owner, const std::string& object, Observer observer) override {
    mObservers[{owner, object}] = std::move(observer);
    return Status::Ok();
  }
  void removeObserver(const void* owner, const std::string& object) override {
    mObservers.erase({owner, object});
  }
  Status post(Notification notification) override {
    std::lock_guard<std::mutex> lock(mLock);
    mPosted.push_back(std::move(notification));
    return Status::Ok();
  }
  void suspend() override { mSuspended = true; }
  void resume() override {
    mSuspended = false;
    std::deque<Notification> held;
    held.swap(mHeld);
    for (const Notification& notification : held) deliver(notification);
  }
  void flush(double) override {}

  // What a sender elsewhere posts: held while suspended, else delivered at once.
  void receive(const Notification& notification) {
    if (mSuspended) {
      mHeld.push_back(notification);
    } else {
      deliver(notification);
    }
  }
  std::vector<Notification> posted() {
    std::lock_guard<std::mutex> lock(mLock);
    return mPosted;
  }
  size_t observations() const { return mObservers.size(); }

 private:
  void deliver(const Notification& notification) {
    for (const auto& [key, observer] : mObservers) {
      if (key.second == notification.object) observer(notification);
    }
  }

  std::map<std::pair<const void*, std::string>, Observer> mObservers;
  bool mSuspended = false;
  std::deque<Notification> mHeld;
  std::mutex mLock;
  std::vector<Notification> mPosted;
};

}  // namespace tarvod
