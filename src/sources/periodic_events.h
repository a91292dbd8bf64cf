// Periodic events: the configuration's periodicEvents entries become timers on the main
// loop that raise { eventType = ... } events through the Monitor, every startInterval
// seconds or daily at startTime minutes after local midnight. Main thread.
#pragma once

#include <cstdint>
#include <memory>
#include <vector>

#include "platform/clock.h"
#include "platform/timers.h"
#include "plist/value.h"
#include "sources/monitor.h"

namespace tarvod {

// The running timers, one per accepted entry, in the order of the entries. Destroying them
// cancels them.
using RunningTimers = std::vector<std::unique_ptr<TimerHandle>>;

// Interval timers are never shorter than this.
inline constexpr double kMinimumPeriodicInterval = 0.1;

// Reads periodicEvents from configuration and schedules one timer per entry. An entry whose
// startInterval is present but not a positive number (0, negative, non-numeric, which would
// fire continuously) is refused with a level-0 message naming it, as is an entry that is not
// a dictionary; monitor, timers and clock must outlive the timers.
RunningTimers CreatePeriodicEvents(const plist::Dictionary& configuration, Monitor& monitor,
                                   Timers& timers, const Clock& clock);
// Stops every timer; none fires afterwards.
void CancelPeriodicEvents(RunningTimers& timers);

// Local midnight at the start of the calendar day after today.
double NextMidnight(const Clock& clock);
// A daily timer's first firing: startTime minutes after NextMidnight, by the local clock.
double FirstDailyFiring(double now, int32_t startTime);
// The firing after the one due at `fired`: startTime minutes (taken modulo a day) after local
// midnight of a later calendar day, recomputed from the calendar so that a change of the
// local clock does not shift the hour; a timer that fell behind skips to the next one
// after now.
double NextDailyFiring(double fired, double now, int32_t startTime);

}  // namespace tarvod
