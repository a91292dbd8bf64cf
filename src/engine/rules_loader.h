// Rules files: LoadRulesFile reads one property-list array of rules into the rulebase,
// LoadRulesDirectory every file below a directory; both return how many rules they accepted.
// Runs on the main thread at startup, as a job on the processing queue at reload.
#pragma once

#include <optional>
#include <string>

#include "context/types.h"
#include "plist/value.h"

namespace tarvod {

size_t LoadRulesFile(const RulebasePtr& rulebase, const VariableStorePtr& variables,
                     const std::string& path);
size_t LoadRulesDirectory(const RulebasePtr& rulebase, const VariableStorePtr& variables,
                          const std::string& path);
// A variables file's dictionary; nullopt (with its level-4 message) when it cannot be read.
std::optional<plist::Dictionary> LoadVariablesFile(const std::string& path);

}  // namespace tarvod
