// Opening the error and event logs named by the configuration. Main thread, once at startup.
#pragma once

#include "plist/value.h"

namespace tarvod {

// The one log directory that is created when the error log is placed inside it.
inline constexpr const char* kVelkinLogDirectory = "/var/log/velkin";

// Sets the error log's repeat interval (logRepeatInterval, seconds; 10 when absent, 0 or less
// writes every line), opens the error log (errorLogPath) and, when logEvents is non-zero, the
// event log (eventLogPath). Reports on the console; returns 0, or -1 when a log cannot be opened.
int SetUpLogs(const plist::Dictionary& configuration);

}  // namespace tarvod
