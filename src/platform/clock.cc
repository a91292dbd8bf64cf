#include "platform/clock.h"

#include <chrono>

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

}  // namespace tarvod
