// The configuration file: a property list whose `config` dictionary holds the daemon's
// settings and whose `initialGlobals` dictionary seeds the global variables. Main thread.
#pragma once

#include <string>
#include <vector>

#include "engine/rules_check.h"
#include "plist/value.h"

namespace tarvod {

inline constexpr const char* kDefaultConfigurationPath = "/etc/tarvod.d/tarvod.plist";
inline constexpr const char* kDefaultRulesPath = "/etc/tarvod.d/rules/";

// Merges the file's `config` entries into *configuration and its `initialGlobals` entries into
// *globals; either pointer may be null to skip that part. A missing or unreadable file, or
// one whose root is not a dictionary, counts as empty. Never logs.
void LoadConfiguration(const std::string& path, plist::Dictionary* globals,
                       plist::Dictionary* configuration);

// Appends the problems of the configuration file at path: a file that is not a property-list
// dictionary, unknown keys, values of the wrong kind, periodicEvents entries the timers would
// refuse. A missing file is a warning: the defaults apply.
void CheckConfiguration(const std::string& path, std::vector<Problem>& problems);

// A configuration value read as an integer (numbers, booleans and numeric strings); fallback
// when the key is absent.
int64_t ConfigurationInteger(const plist::Dictionary& configuration, std::string_view key,
                             int64_t fallback = 0);
// A configuration value that must be a string; fallback when absent or of another kind.
std::string ConfigurationString(const plist::Dictionary& configuration, std::string_view key,
                                std::string_view fallback = {});

}  // namespace tarvod
