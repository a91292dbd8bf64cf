// The daemon-wide shared containers: the variable store and the rulebase.
//
// The variable store is touched only on the processing queue; the Engine that owns it hands
// it to other threads only through its queue (Engine::withVariables). The rulebase is built
// by the loader and then shared as const, except for the atomic per-type event counters.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "plist/value.h"

namespace tarvod {

// `_globals` holds the global variables; each rules file's path holds that file's variables.
using VariableStore = plist::Dictionary;
using VariableStorePtr = std::shared_ptr<VariableStore>;
inline constexpr const char* kGlobalsKey = "_globals";

using Rule = plist::Dictionary;
using RulePtr = std::shared_ptr<const Rule>;

struct RulebaseEntry {
  std::vector<RulePtr> rules;  // in load order; a rule listed under several types is shared
  // Events of this type dispatched since the rules were loaded.
  mutable std::atomic<uint64_t> eventCounter{0};
  mutable std::atomic<double> lastEventTimestamp{0.0};
};

// Event type to entry. std::map keeps entries at stable addresses; the transparent comparison
// lets dispatch look up the prefixes of a type without copying them.
using Rulebase = std::map<std::string, RulebaseEntry, std::less<>>;
using RulebasePtr = std::shared_ptr<const Rulebase>;

// The rulebase as a property-list value: { type = { rules = (...); eventCounter = n;
// lastEventTimestamp = t; }; }, for messages and dumps.
plist::Value RulebaseToValue(const Rulebase& rulebase);

}  // namespace tarvod
