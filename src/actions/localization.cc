#include "actions/localization.h"

#include <map>
#include <optional>
#include <vector>

#include "platform/bundle.h"
#include "platform/diagnostic_log.h"
#include "plist/codec.h"
#include "plist/value.h"

namespace tarvod {
namespace {

const std::map<std::string, std::string>& DomainLanguages() {
  static const std::map<std::string, std::string> table = {
      {"com", "en"}, {"net", "en"}, {"org", "en"}, {"uk", "en"}, {"nz", "en"},
      {"fr", "fr"},  {"gf", "fr"},  {"pf", "fr"},  {"tf", "fr"}, {"de", "de"},
      {"jp", "ja"},  {"cn", "zh"},  {"no", "no"},
  };
  return table;
}

using LocalizationLists = std::map<std::string, std::vector<std::string>>;
// bundle path -> table -> localization -> source text -> translation
using StringCache =
    std::map<std::string,
             std::map<std::string, std::map<std::string, std::map<std::string, std::string>>>>;

LocalizationLists& ListCache() {
  static LocalizationLists cache;
  return cache;
}

StringCache& Strings() {
  static StringCache cache;
  return cache;
}

std::string ListText(const std::vector<std::string>& names) {
  plist::Array array;
  for (const std::string& name : names) array.emplace_back(name);
  return plist::Value(std::move(array)).textForm();
}

std::optional<std::string> TableEntry(const std::string& path, const std::string& text) {
  if (path.empty()) return std::nullopt;
  const std::optional<plist::Value> table = plist::ReadPropertyListFile(path);
  if (!table || !table->isDictionary()) return std::nullopt;
  const plist::Value* entry = table->dictionary().find(text);
  if (entry == nullptr) return std::nullopt;
  return entry->textForm();
}

// The chosen localization's table first, then the bundle's own choice of localization.
std::string StringsLookup(const std::string& text, const Bundle& bundle, const std::string& table,
                          const std::string& localization) {
  if (auto found = TableEntry(StringsTablePath(bundle, table, localization), text)) {
    return *found;
  }
  if (!bundle.preferred.empty()) {
    auto found = TableEntry(StringsTablePath(bundle, table, bundle.preferred.front()), text);
    if (found && !found->empty()) return *found;
  }
  return text;
}

}  // namespace

std::string AddressLanguage(std::string* address) {
  LogMessage(4, "extracting localization info from %s", address->c_str());
  std::string language;
  const size_t colon = address->find(':');
  if (colon != std::string::npos && colon <= 3) {
    language = address->substr(0, colon);
    address->erase(0, colon + 1);
  }
  if (language.empty()) {
    const size_t dot = address->rfind('.');
    const std::string domain = dot == std::string::npos ? *address : address->substr(dot + 1);
    const auto found = DomainLanguages().find(domain);
    if (found != DomainLanguages().end()) language = found->second;
  }
  if (language.empty()) language = "en";
  LogMessage(4, "found localization  %s", language.c_str());
  return language;
}

std::string LocalizeText(const std::string& text, const std::string& language,
                         const std::string& bundlePath, const std::string& table) {
  LogMessage(4, "\t\tlocalizing: %s", text.c_str());
  if (text.empty() || language.empty() || bundlePath.empty()) return text;

  std::optional<Bundle> bundle;
  std::vector<std::string> localizations;
  if (const auto cached = ListCache().find(bundlePath); cached != ListCache().end()) {
    LogMessage(6, "\t\tGetting localization array from the cache");
    LogMessage(6, "\t\t\tarray is %s", ListText(cached->second).c_str());
    localizations = cached->second;
  } else {
    bundle = OpenBundle(bundlePath);
    if (!bundle) {
      LogMessage(0, "The bundle at %s could not be resolved", bundlePath.c_str());
      return text;
    }
    localizations = bundle->preferred;
    LogMessage(6, "\t\tLocalization Array (preferred) = %s", ListText(localizations).c_str());
    if (localizations.size() == 1) {
      localizations = bundle->localizations;
      LogMessage(6, "\t\tLocalization Array (all) = %s", ListText(localizations).c_str());
    }
    ListCache()[bundlePath] = localizations;
  }
  if (localizations.empty()) return text;

  const std::vector<std::string> ordered = OrderLocalizations(localizations, {language});
  LogMessage(6, "\t\tfor id = :%s: the ordered localizations = %s", language.c_str(),
             ListText(ordered).c_str());
  if (ordered.empty()) return text;
  const std::string& localization = ordered.front();
  LogMessage(5, "\t\tlanguageIdentifier = %s localization = %s", language.c_str(),
             localization.c_str());

  const std::string tableName = table.empty() ? "Localizable" : table;
  auto& entries = Strings()[bundlePath][tableName][localization];
  std::string result;
  if (const auto found = entries.find(text); found != entries.end()) {
    LogMessage(5, "getting localized string ouf of the cache");
    result = found->second;
  } else {
    if (!bundle) bundle = OpenBundle(bundlePath);
    if (!bundle) {
      LogMessage(0, "The bundle at %s could not be loaded", bundlePath.c_str());
      return text;
    }
    result = StringsLookup(text, *bundle, tableName, localization);
    entries[text] = result;
  }
  LogMessage(4, "\t\t       To: %s", result.c_str());
  return result;
}

}  // namespace tarvod
