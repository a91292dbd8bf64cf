// The per-event record in the structured system log: the event's keys and details flattened
// into string attributes, the event time, whether rules existed and whether none fired.
// WriteEventRecord may be called from any thread; failures are logged and cost that record.
#pragma once

#include "plist/value.h"

namespace tarvod {

void WriteEventRecord(const plist::Dictionary& event, bool hasRules, bool eventBlocked);

}  // namespace tarvod
