// Unit-test clock: time stands still until the test moves it. Test thread only.
#pragma once

#include "platform/clock.h"

namespace tarvod::testing {

class FakeClock final : public Clock {
 public:
  double now() override { return mNow; }
  void advance(double seconds) { mNow += seconds; }

 private:
  double mNow = 1000.0;
};

}  // namespace tarvod::testing
