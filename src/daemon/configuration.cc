#include "daemon/configuration.h"

#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <cmath>

#include "plist/codec.h"

namespace tarvod {
namespace {

using Severity = Problem::Severity;

constexpr std::array<std::string_view, 2> kTopLevelKeys = {"config", "initialGlobals"};
constexpr std::array<std::string_view, 10> kStringKeys = {
    "errorLogPath",  "eventLogPath",   "keychainPath", "structuredLogPath", "eventSocketPath",
    "authLogSource", "stateDirectory", "rulesPath",    "mailProgram",       "relayMailProgram"};
constexpr std::array<std::string_view, 2> kIdListKeys = {"filterByUID", "filterByGID"};
constexpr std::array<std::string_view, 6> kNumberKeys = {
    "debugLevel",     "logRepeatInterval",     "shutdownTimeout",
    "commandTimeout", "connectionIdleTimeout", "maxConnectionsPerUID"};
constexpr std::array<std::string_view, 3> kSwitchKeys = {"logEvents", "saveState",
                                                         "keepLogFilesOpen"};
constexpr std::array<std::string_view, 3> kPeriodicKeys = {"eventType", "startInterval",
                                                           "startTime"};

template <size_t N>
bool Contains(const std::array<std::string_view, N>& names, std::string_view name) {
  return std::find(names.begin(), names.end(), name) != names.end();
}

std::vector<std::string_view> KnownConfigKeys() {
  std::vector<std::string_view> keys(kStringKeys.begin(), kStringKeys.end());
  keys.insert(keys.end(), kIdListKeys.begin(), kIdListKeys.end());
  keys.insert(keys.end(), kNumberKeys.begin(), kNumberKeys.end());
  keys.insert(keys.end(), kSwitchKeys.begin(), kSwitchKeys.end());
  keys.push_back("periodicEvents");
  return keys;
}

bool IsNumeric(const plist::Value& value) {
  if (value.isNumber()) return true;
  if (!value.isString() || value.string().empty()) return false;
  char* end = nullptr;
  std::strtod(value.string().c_str(), &end);
  return *end == '\0';
}

void CheckPeriodicEvents(const plist::Value& entries, const std::string& path,
                         std::vector<Problem>& problems) {
  auto add = [&](Severity severity, std::string key, std::string message) {
    problems.push_back(Problem{severity, path, 0, "", std::move(key), std::move(message)});
  };
  if (!entries.isArray()) {
    add(Severity::kError, "config.periodicEvents", "must be an array; no timer is created");
    return;
  }
  size_t index = 0;
  for (const plist::Value& item : entries.array()) {
    const std::string at = "config.periodicEvents[" + std::to_string(++index) + "]";
    const plist::Dictionary* entry = item.asDictionary();
    if (entry == nullptr) {
      add(Severity::kError, at, "must be a dictionary; no timer is created");
      continue;
    }
    for (const std::string& key : entry->sortedKeys()) {
      if (Contains(kPeriodicKeys, key)) continue;
      add(Severity::kError, at + "." + key,
          "unknown key, ignored" + Suggestion(key, kPeriodicKeys));
    }
    const plist::Value* type = entry->find("eventType");
    if (type == nullptr || !type->isString()) {
      add(Severity::kError, at + ".eventType", "must be a string; the events have no type");
    }
    // The refusal CreatePeriodicEvents makes: an interval that would fire without pause.
    if (const plist::Value* interval = entry->find("startInterval")) {
      const double period = interval->numberValue();
      if (!(period > 0) || !std::isfinite(period)) {
        add(Severity::kError, at + ".startInterval",
            "\"" + interval->textForm() +
                "\" is not a positive number of seconds; no timer is "
                "created");
      }
    } else if (const plist::Value* time = entry->find("startTime"); time && !time->isNumber()) {
      add(Severity::kError, at + ".startTime",
          "must be an integer number of minutes after midnight");
    } else if (time == nullptr) {
      add(Severity::kWarning, at, "neither startInterval nor startTime; fires daily at midnight");
    }
  }
}

}  // namespace

void CheckConfiguration(const std::string& path, std::vector<Problem>& problems) {
  auto add = [&](Severity severity, std::string key, std::string message) {
    problems.push_back(Problem{severity, path, 0, "", std::move(key), std::move(message)});
  };
  struct stat info {};
  if (stat(path.c_str(), &info) != 0) {
    add(Severity::kWarning, "", "cannot be read; the defaults apply");
    return;
  }
  std::optional<plist::Value> file = plist::ReadPropertyListFile(path);
  if (!file || !file->isDictionary()) {
    add(Severity::kError, "",
        file ? "the top level is not a dictionary; the defaults apply"
             : "cannot be read as a property list; the defaults apply");
    return;
  }
  const plist::Dictionary& root = file->dictionary();
  for (const std::string& key : root.sortedKeys()) {
    if (!Contains(kTopLevelKeys, key)) {
      add(Severity::kError, key, "unknown key, ignored" + Suggestion(key, kTopLevelKeys));
    }
  }
  const plist::Value* initial = root.find("initialGlobals");
  if (initial && !initial->isDictionary()) {
    add(Severity::kError, "initialGlobals", "must be a dictionary; no global is set");
  }
  const plist::Value* configValue = root.find("config");
  if (configValue == nullptr) return;
  const plist::Dictionary* config = configValue->asDictionary();
  if (config == nullptr) {
    add(Severity::kError, "config", "must be a dictionary; the defaults apply");
    return;
  }
  const std::vector<std::string_view> known = KnownConfigKeys();
  for (const std::string& key : config->sortedKeys()) {
    const plist::Value& value = *config->find(key);
    const std::string at = "config." + key;
    if (key == "runningTimers") {
      add(Severity::kError, at, "reserved for the daemon's timers; must not be set");
    } else if (key == "periodicEvents") {
      CheckPeriodicEvents(value, path, problems);
    } else if (Contains(kStringKeys, key) || Contains(kIdListKeys, key)) {
      if (!value.isString()) add(Severity::kError, at, "must be a string");
    } else if (Contains(kNumberKeys, key)) {
      if (!IsNumeric(value)) add(Severity::kError, at, "must be a number");
    } else if (Contains(kSwitchKeys, key)) {
      if (!value.isBoolean() && !IsNumeric(value)) add(Severity::kError, at, "must be a boolean");
    } else {
      add(Severity::kError, at, "unknown key, ignored" + Suggestion(key, known));
    }
  }
  if (config->contains("rulesPath")) {
    add(Severity::kWarning, "config.rulesPath", "has no effect; the rules path is set with -r");
  }
}

void LoadConfiguration(const std::string& path, plist::Dictionary* globals,
                       plist::Dictionary* configuration) {
  std::optional<plist::Value> file = plist::ReadPropertyListFile(path);
  if (!file || !file->isDictionary()) return;
  const plist::Dictionary& root = file->dictionary();
  if (configuration) {
    if (const plist::Dictionary* config = root.findDictionary("config")) {
      for (const auto& [key, value] : *config) configuration->set(key, value);
    }
  }
  if (globals) {
    if (const plist::Dictionary* initial = root.findDictionary("initialGlobals")) {
      for (const auto& [key, value] : *initial) globals->set(key, value);
    }
  }
}

int64_t ConfigurationInteger(const plist::Dictionary& configuration, std::string_view key,
                             int64_t fallback) {
  const plist::Value* value = configuration.find(key);
  return value ? value->integerValue() : fallback;
}

std::string ConfigurationString(const plist::Dictionary& configuration, std::string_view key,
                                std::string_view fallback) {
  const std::string* value = configuration.findString(key);
  return value ? *value : std::string(fallback);
}

}  // namespace tarvod
