// The "log" action: one message, after substitution, to the structured system log or appended
// as one line to a file. Runs on the processing queue; BuildLevelNameTable runs once at
// startup, before any rule. Failures are logged and end only the action.
#pragma once

#include "context/context.h"
#include "plist/value.h"

namespace tarvod {

void DoLogAction(const plist::Dictionary& action, const Rule& rule, Context& context);
// Builds the level-name table ("emergency" 0 to "debug" 7); later calls leave it as it is.
void BuildLevelNameTable();

}  // namespace tarvod
