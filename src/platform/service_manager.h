// The service manager: systemd's manager on the system bus (DBUS_SYSTEM_BUS_ADDRESS when
// set). Main thread; each call waits for systemd's reply, at most timeoutSeconds.
#pragma once

#include <string>

#include "platform/status.h"

namespace tarvod {

// Enables the unit's file and starts the unit. On failure the Status's what() is the text of
// the bus error ("The name org.freedesktop.systemd1 was not provided by any .service files").
Status EnableAndStartUnit(const std::string& unit, double timeoutSeconds);

}  // namespace tarvod
