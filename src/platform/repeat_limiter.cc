#include "platform/repeat_limiter.h"

#include <cstdio>

namespace tarvod {

RepeatLimiter::RepeatLimiter(const Clock& clock, double intervalSeconds, size_t maxKeys)
    : mClock(clock), mInterval(intervalSeconds), mMaxKeys(maxKeys > 0 ? maxKeys : 1) {}

void RepeatLimiter::close(std::vector<std::string>& summaries) {
  const Window& oldest = mWindows.front();
  if (oldest.repeats > 0) {
    char tail[96];
    std::snprintf(tail, sizeof tail, " repeated %llu times in the last %g s",
                  static_cast<unsigned long long>(oldest.repeats), mInterval);
    summaries.push_back(oldest.text + tail);
  }
  mByText.erase(oldest.text);
  mWindows.pop_front();
}

void RepeatLimiter::collectEnded(std::vector<std::string>& summaries) {
  if (!mWindows.empty()) collectEndedAt(mClock.monotonic(), summaries);
}

void RepeatLimiter::collectEndedAt(double now, std::vector<std::string>& summaries) {
  // The same sum as nextEnd, so that a wait until nextEnd always finds its window ended.
  while (!mWindows.empty() && now >= mWindows.front().start + mInterval) close(summaries);
}

void RepeatLimiter::collectAll(std::vector<std::string>& summaries) {
  while (!mWindows.empty()) close(summaries);
}

bool RepeatLimiter::admit(std::string_view text, std::vector<std::string>& summaries) {
  if (mInterval <= 0) {
    collectAll(summaries);  // windows opened before the limit was turned off
    return true;
  }
  const double now = mClock.monotonic();
  collectEndedAt(now, summaries);
  if (const auto found = mByText.find(text); found != mByText.end()) {
    ++found->second->repeats;
    return false;
  }
  if (mWindows.size() >= mMaxKeys) close(summaries);
  mWindows.push_back(Window{std::string(text), now, 0});
  mByText.emplace(mWindows.back().text, std::prev(mWindows.end()));
  return true;
}

std::optional<double> RepeatLimiter::nextEnd() const {
  if (mWindows.empty()) return std::nullopt;
  return mWindows.front().start + mInterval;
}

}  // namespace tarvod
