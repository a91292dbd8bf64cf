// The Monitor's connection to the rule engine, kept apart so that the sources can be built
// and tested without it.
#include "engine/dispatch.h"
#include "engine/keyword_tables.h"
#include "sources/monitor.h"

namespace tarvod {

Monitor::Monitor(RulebasePtr rulebase, VariableStorePtr variables)
    : Monitor(std::move(rulebase), std::move(variables),
              MonitorHooks{DispatchEvent, [] { return ProcessingQueue().pending(); }}) {}

}  // namespace tarvod
