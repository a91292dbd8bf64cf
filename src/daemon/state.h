// Saved state: with saveState on, the variable store is written to <stateDirectory>/state at
// shutdown and merged back at the next start, so that the file-local variables of rules
// survive a restart. Main thread; the store is read and written through the Engine's queue.
#pragma once

#include "engine/engine.h"
#include "platform/files.h"
#include "plist/value.h"

namespace tarvod {

inline constexpr const char* kDefaultStateDirectory = "/var/lib/tarvod";

// Merges the state file into the store; the store's own entries win. A missing, unreadable
// or foreign file (a link, not a regular file, another owner), or one whose root is not a
// dictionary, restores nothing. Logs nothing.
void RestoreState(const plist::Dictionary& configuration, Engine& engine, Files& files);
// Writes the store. After a crash at any instant "state" is a complete old or new copy.
void SaveState(const plist::Dictionary& configuration, Engine& engine, Files& files);

}  // namespace tarvod
