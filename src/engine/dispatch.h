// The rule engine's entry point. DispatchEvent may be called from any thread; it never waits
// for rules: it queues one job per rule and one record job per matching type prefix on the
// processing queue.
#pragma once

#include "context/types.h"
#include "plist/value.h"

namespace tarvod {

void DispatchEvent(const RulebasePtr& rulebase, const plist::Dictionary& event,
                   const VariableStorePtr& variables);
// "startup.load" (or "startup.reload" when reload is true) and "shutdown", from "tarvod".
void PostStartupEvent(const RulebasePtr& rulebase, const VariableStorePtr& variables, bool reload);
void PostShutdownEvent(const RulebasePtr& rulebase, const VariableStorePtr& variables);

// Seconds since 2001-01-01 00:00:00 UTC, now.
double CurrentTimeSince2001();

}  // namespace tarvod
