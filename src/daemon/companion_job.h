// The companion log job com.quenta.tarvlog, enabled and started at startup. Main thread.
#pragma once

namespace tarvod {

// Asks the service manager to enable and start com.quenta.tarvlog.service; any failure is
// logged as "Enable tarvlog job failed %s" at level 2 and the daemon runs on.
void EnableCompanionLogJob();

}  // namespace tarvod
