#include "sources/periodic_events.h"

#include <algorithm>
#include <climits>
#include <cmath>

#include "platform/diagnostic_log.h"

namespace tarvod {
namespace {

constexpr int64_t kMinutesPerDay = 24 * 60;

}  // namespace

double NextMidnight(const Clock& clock) { return LocalDayTime(clock.now(), 1, 0); }

double FirstDailyFiring(double now, int32_t startTime) { return LocalDayTime(now, 1, startTime); }

double NextDailyFiring(double fired, double now, int32_t startTime) {
  const int64_t minutes = ((startTime % kMinutesPerDay) + kMinutesPerDay) % kMinutesPerDay;
  const double after = std::max(fired, now);
  double next = LocalDayTime(after, 0, minutes);
  // Never twice on one calendar day, even when a clock change repeats the hour.
  if (next <= after || LocalDayTime(next, 0, 0) <= LocalDayTime(fired, 0, 0)) {
    next = LocalDayTime(after, 1, minutes);
  }
  return next;
}

RunningTimers CreatePeriodicEvents(const plist::Dictionary& configuration, Monitor& monitor,
                                   Timers& timers, const Clock& clock) {
  RunningTimers running;
  const plist::Value* entries = configuration.find("periodicEvents");
  if (entries == nullptr) {
    LogMessage(3, "No Periodic Events configured");
    return running;
  }
  if (!entries->isArray()) {
    LogMessage(0, "CreatePeriodicEvents: periodicEvents is not an array; no timer created");
    return running;
  }
  size_t index = 0;
  for (const plist::Value& item : entries->array()) {
    ++index;
    const plist::Dictionary* entry = item.asDictionary();
    if (entry == nullptr) {
      LogMessage(0, "CreatePeriodicEvents: entry %zu is not a dictionary; no timer created", index);
      continue;
    }
    const plist::Value* type = entry->find("eventType");
    const std::string typeText = type ? type->textForm() : "(null)";
    LogMessage(4, "\nCreatePeriodicEvents: creating timer for %s\n", typeText.c_str());
    plist::Dictionary event;
    if (type) event.set("eventType", *type);

    std::unique_ptr<TimerHandle> timer;
    if (const plist::Value* interval = entry->find("startInterval")) {
      double period = interval->numberValue();
      if (!(period > 0) || !std::isfinite(period)) {
        LogMessage(0,
                   "CreatePeriodicEvents: entry %zu (%s) has startInterval %s, not a positive "
                   "number of seconds; no timer created",
                   index, typeText.c_str(), interval->textForm().c_str());
        continue;
      }
      if (period < kMinimumPeriodicInterval) {
        LogMessage(1, "CreatePeriodicEvents: entry %zu (%s): startInterval %g raised to %g", index,
                   typeText.c_str(), period, kMinimumPeriodicInterval);
        period = kMinimumPeriodicInterval;
      }
      timer = timers.repeating(period, [&monitor, event] { monitor.periodicEvent(event); });
    } else {
      const plist::Value* time = entry->find("startTime");
      const auto startTime = static_cast<int32_t>(
          std::clamp<int64_t>(time ? time->integerValue() : 0, INT32_MIN, INT32_MAX));
      const double first = FirstDailyFiring(clock.now(), startTime);
      timer =
          timers.wallClock(first, [&monitor, &clock, event, startTime, fired = first]() mutable {
            monitor.periodicEvent(event);
            fired = NextDailyFiring(fired, clock.now(), startTime);
            return fired;
          });
    }
    if (!timer) {
      LogMessage(0, "CreatePeriodicEvents: entry %zu (%s): the timer cannot be created", index,
                 typeText.c_str());
      continue;
    }
    running.push_back(std::move(timer));
  }
  LogMessage(3, "%d Periodic Events configured", static_cast<int>(running.size()));
  return running;
}

void CancelPeriodicEvents(RunningTimers& timers) { timers.clear(); }

void Monitor::periodicEvent(const plist::Dictionary& event) {
  if (DebugLevel() >= 3) {
    LogMessage(3, "Periodic Event received: %s ", plist::Describe(event).c_str());
  }
  // Not processEvent: periodic events are not reported as "Event received".
  countEvent(EventSource::kPeriodic);
  if (mHooks.dispatch) mHooks.dispatch(plist::Dictionary(event));
}

}  // namespace tarvod
