// The Monitor's connection to the rule engine, kept apart so that the sources can be built
// and tested without it.
#pragma once

#include "engine/engine.h"
#include "sources/monitor.h"

namespace tarvod {

// Hooks that dispatch into engine and watch its processing queue; engine must outlive the
// Monitor.
MonitorHooks EngineHooks(Engine& engine);

}  // namespace tarvod
