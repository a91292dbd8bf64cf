// The configuration file: a property list whose `config` dictionary holds the daemon's
// settings and whose `initialGlobals` dictionary seeds the global variables. Main thread.
#pragma once

#include <string>

#include "plist/value.h"

namespace tarvod {

inline constexpr const char* kDefaultConfigurationPath = "/etc/tarvod.d/tarvod.plist";
inline constexpr const char* kDefaultRulesPath = "/etc/tarvod.d/rules/";

// Merges the file's `config` entries into *configuration and its `initialGlobals` entries into
// *globals; either pointer may be null to skip that part. A missing or unreadable file, or
// one whose root is not a dictionary, counts as empty. Never logs.
void LoadConfiguration(const std::string& path, plist::Dictionary* globals,
                       plist::Dictionary* configuration);

// A configuration value read as an integer (numbers, booleans and numeric strings); fallback
// when the key is absent.
int64_t ConfigurationInteger(const plist::Dictionary& configuration, std::string_view key,
                             int64_t fallback = 0);
// A configuration value that must be a string; fallback when absent or of another kind.
std::string ConfigurationString(const plist::Dictionary& configuration, std::string_view key,
                                std::string_view fallback = {});

}  // namespace tarvod
