#include "sources/notifications.h"

#include "platform/diagnostic_log.h"

namespace tarvod {

int RegisterNotifications(NotificationCenter& center, const Rulebase& rulebase, Monitor& monitor) {
  LogMessage(1, "REGISTERING EVENTS");
  int registered = 0;
  for (const auto& [type, entry] : rulebase) {
    LogMessage(2, "  Registering %s", type.c_str());
    const Status added = center.addObserver(
        &monitor, type, [&monitor](const Notification& n) { monitor.processNotification(n); });
    if (added.ok()) {
      ++registered;
    } else {
      LogMessage(1, "  Registering %s failed: %s", type.c_str(), added.what().c_str());
    }
  }
  LogMessage(1, "Registered %d events", registered);
  return registered;
}

void UnregisterNotifications(NotificationCenter& center, const Rulebase& rulebase,
                             Monitor& monitor) {
  for (const auto& [type, entry] : rulebase) {
    LogMessage(2, "    de-registering %s", type.c_str());
    center.removeObserver(&monitor, type);
  }
}

void Monitor::processNotification(const Notification& notification) {
  LogMessage(3, "NOTIFICATION RECEIVED: %s ", notification.name.c_str());
  if (DebugLevel() >= 5) {
    LogMessage(5, "Description:\n%s ", DescribeNotification(notification).c_str());
  }
  // Not processEvent: notifications are not reported as "Event received".
  countEvent(EventSource::kNotifications);
  if (mHooks.dispatch) mHooks.dispatch(notification.userInfo.value_or(plist::Dictionary()));
}

}  // namespace tarvod
