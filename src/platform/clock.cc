#include "platform/clock.h"

#include <time.h>

#include <algorithm>
#include <chrono>
#include <climits>
#include <cmath>

#include "plist/value.h"

namespace tarvod {
namespace {

class SystemClock final : public Clock {
 public:
  double now() const override {
    const auto sinceEpoch = std::chrono::system_clock::now().time_since_epoch();
    return std::chrono::duration<double>(sinceEpoch).count() - plist::kUnixTimeOfReferenceDate;
  }
  double monotonic() const override {
    const auto sinceBoot = std::chrono::steady_clock::now().time_since_epoch();
    return std::chrono::duration<double>(sinceBoot).count();
  }
};

}  // namespace

Clock& Clock::System() {
  static SystemClock clock;
  return clock;
}

std::string LocalDateText(const Clock& clock) {
  return plist::FormatDate(plist::Date{clock.now()}, true);
}

double LocalDayTime(double instant, int days, int64_t minutes) {
  const time_t t = static_cast<time_t>(std::floor(instant + plist::kUnixTimeOfReferenceDate));
  struct tm local {};
  localtime_r(&t, &local);
  local.tm_mday += days;
  local.tm_hour = 0;
  local.tm_min = static_cast<int>(std::clamp<int64_t>(minutes, INT_MIN / 2, INT_MAX / 2));
  local.tm_sec = 0;
  local.tm_isdst = -1;  // the zone's rule for that day decides
  return static_cast<double>(mktime(&local)) - plist::kUnixTimeOfReferenceDate;
}

}  // namespace tarvod
