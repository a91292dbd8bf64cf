#include "daemon/state.h"

#include <optional>
#include <string>

#include "daemon/configuration.h"
#include "platform/diagnostic_log.h"
#include "plist/codec.h"

namespace tarvod {
namespace {

std::string StateDirectory(const plist::Dictionary& configuration) {
  return ConfigurationString(configuration, "stateDirectory", kDefaultStateDirectory);
}

// Replaces an existing state file. The copy being replaced is kept under a second name
// (state_prev) with a link rather than moved away, so that "state" never goes missing: the
// one rename that installs the new copy is atomic.
bool ReplaceStateFile(Files& files, const std::string& directory, const std::string& data) {
  const std::string state = directory + "/state";
  const std::string temporary = directory + "/state_temp";
  const std::string previous = directory + "/state_prev";
  if (!files.writeAtomically(temporary, data).ok()) return false;
  files.remove(previous);
  if (!files.link(state, previous).ok()) return false;
  return files.rename(temporary, state).ok();
}

}  // namespace

void RestoreState(const plist::Dictionary& configuration, Engine& engine, Files& files) {
  if (ConfigurationInteger(configuration, "saveState") == 0) return;
  Result<std::string> bytes = files.readOwnedFile(StateDirectory(configuration) + "/state");
  if (!bytes.ok()) return;
  std::optional<plist::Value> saved = plist::ReadPropertyList(bytes.value());
  if (!saved || !saved->isDictionary()) return;
  engine.withVariables([&](VariableStore& store) {
    // The entries the store already has win: a saved entry is taken only under a new key.
    for (auto& [key, value] : saved->dictionary()) {
      if (!store.contains(key)) store.set(key, std::move(value));
    }
  });
}

void SaveState(const plist::Dictionary& configuration, Engine& engine, Files& files) {
  const std::string directory = StateDirectory(configuration);
  files.makeDirectories(directory, 0700);

  // Serialised on the processing queue: rules may be changing the store.
  std::optional<std::string> data;
  const bool ran = engine.withVariables(
      [&](VariableStore& store) { data = plist::WriteXmlPropertyList(plist::Value(store)); });
  if (!ran || !data) {
    LogMessage(1, "Failed to prepare the state data for saving");
    return;
  }
  if (ConfigurationInteger(configuration, "saveState") == 0) return;

  const bool saved = files.exists(directory + "/state")
                         ? ReplaceStateFile(files, directory, *data)
                         : files.writeAtomically(directory + "/state", *data).ok();
  if (!saved) LogMessage(1, "Failed to save the state data");
}

}  // namespace tarvod
