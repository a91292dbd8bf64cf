// Opening the error and event logs named by the configuration. Main thread: at startup, and
// again at each reload so that a rotated log is written afresh.
#pragma once

#include "plist/value.h"

namespace tarvod {

// The one log directory that is created when the error log is placed inside it.
inline constexpr const char* kVelkinLogDirectory = "/var/log/velkin";

// Sets the error log's repeat interval (logRepeatInterval, seconds; 10 when absent, 0 or less
// writes every line), opens the error log (errorLogPath) and, when logEvents is non-zero, the
// event log (eventLogPath). Reports on the console; returns 0, or -1 when a log cannot be opened.
int SetUpLogs(const plist::Dictionary& configuration);
// Opens the same logs again and puts them in place of the open ones. A log that cannot be
// opened now is reported at level 0 and the old file goes on being written.
void ReopenLogs(const plist::Dictionary& configuration);

}  // namespace tarvod
