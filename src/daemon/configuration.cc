#include "daemon/configuration.h"

#include "plist/codec.h"

namespace tarvod {

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
