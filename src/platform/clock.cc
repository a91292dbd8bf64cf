#include "platform/clock.h"

#include <time.h>

namespace tarvod {
namespace {

class HostMonotonicClock final : public Clock {
 public:
  double now() override {
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) * 1e-9;
  }
};

}  // namespace

Clock& MonotonicClock() {
  static HostMonotonicClock clock;
  return clock;
}

}  // namespace tarvod
