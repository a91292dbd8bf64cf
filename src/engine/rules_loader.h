// Rules files: LoadRulesFile reads one property-list array of rules into the rulebase,
// LoadRulesDirectory every file below a directory; both return how many rules they accepted.
// The rulebase being filled is private to the caller until it is complete; the variable store
// is written by "eval on load" variables, so the Engine runs loading on its queue.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "context/types.h"
#include "engine/rules_check.h"
#include "plist/value.h"

namespace tarvod {

class Keychain;

// keychain, when given, serves the "keychain:" references of load-time variables. report, when
// given, receives the files read and skipped, the rules loaded and every file's problems
// (CheckRule); the loader itself accepts and skips rules the same way with or without it.
size_t LoadRulesFile(Rulebase& rulebase, const VariableStorePtr& variables, const std::string& path,
                     const std::shared_ptr<Keychain>& keychain = nullptr,
                     LoadReport* report = nullptr);
// Editors' and package managers' leftovers ("rules.plist~", ".swp", ".dpkg-old", ".rpmnew",
// ...) are skipped, and named in the report.
size_t LoadRulesDirectory(Rulebase& rulebase, const VariableStorePtr& variables,
                          const std::string& path,
                          const std::shared_ptr<Keychain>& keychain = nullptr,
                          LoadReport* report = nullptr);
// A variables file's dictionary; nullopt (with its level-4 message) when it cannot be read.
std::optional<plist::Dictionary> LoadVariablesFile(const std::string& path);

}  // namespace tarvod
