// Notification events: for every event type of the rulebase the Monitor observes the
// distributed notifications whose object is that type, and hands their user information to
// the rule engine as the event. Main thread.
#pragma once

#include "context/types.h"
#include "platform/notification_center.h"
#include "sources/monitor.h"

namespace tarvod {

// One observation per rulebase key; returns how many were added. A key the center cannot
// observe is logged at level 1 and not counted.
int RegisterNotifications(NotificationCenter& center, const Rulebase& rulebase, Monitor& monitor);
// Removes the monitor's observation of every key of rulebase, the one it registered with.
void UnregisterNotifications(NotificationCenter& center, const Rulebase& rulebase,
                             Monitor& monitor);

}  // namespace tarvod
