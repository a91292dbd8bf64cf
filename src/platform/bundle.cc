#include "platform/bundle.h"

#include <dirent.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstdlib>
#include <string_view>

namespace tarvod {
namespace {

constexpr std::string_view kSuffix = ".lproj";
// A bundle directory holds a handful of languages; more entries than this are not read.
constexpr size_t kMaxLocalizations = 1024;

std::string_view LanguagePart(std::string_view code) {
  return code.substr(0, code.find_first_of("_-"));
}

// "de_DE.UTF-8@euro" -> "de_DE"; nothing for C, POSIX and empty values.
std::optional<std::string> LocaleCode(const char* variable) {
  const char* value = std::getenv(variable);
  if (value == nullptr) return std::nullopt;
  std::string_view text(value);
  text = text.substr(0, text.find_first_of(".@"));
  if (text.empty() || text == "C" || text == "POSIX") return std::nullopt;
  return std::string(text);
}

}  // namespace

std::vector<std::string> OrderLocalizations(const std::vector<std::string>& localizations,
                                            const std::vector<std::string>& preferences) {
  std::vector<std::string> ordered;
  const auto add = [&ordered](const std::string& name) {
    if (std::find(ordered.begin(), ordered.end(), name) == ordered.end()) ordered.push_back(name);
  };
  for (const std::string& code : preferences) {
    if (code.empty()) continue;
    for (const std::string& name : localizations) {
      if (name == code) add(name);
    }
    for (const std::string& name : localizations) {
      if (LanguagePart(name) == code) add(name);
    }
  }
  return ordered;
}

std::optional<Bundle> OpenBundle(const std::string& path) {
  DIR* directory = opendir(path.c_str());
  if (directory == nullptr) return std::nullopt;
  Bundle bundle;
  bundle.path = path;
  while (const dirent* entry = readdir(directory)) {
    const std::string_view name(entry->d_name);
    if (name.size() <= kSuffix.size() || !name.ends_with(kSuffix)) continue;
    struct stat info {};
    const std::string full = path + "/" + std::string(name);
    if (stat(full.c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) continue;
    bundle.localizations.emplace_back(name.substr(0, name.size() - kSuffix.size()));
    if (bundle.localizations.size() == kMaxLocalizations) break;
  }
  closedir(directory);
  std::sort(bundle.localizations.begin(), bundle.localizations.end());

  std::vector<std::string> preferences;
  for (const char* variable : {"LC_MESSAGES", "LANG"}) {
    if (const auto code = LocaleCode(variable)) {
      preferences.push_back(*code);
      preferences.emplace_back(LanguagePart(*code));
    }
  }
  bundle.preferred = OrderLocalizations(bundle.localizations, preferences);
  if (bundle.preferred.empty() && !bundle.localizations.empty()) {
    const bool hasEnglish = std::find(bundle.localizations.begin(), bundle.localizations.end(),
                                      "en") != bundle.localizations.end();
    bundle.preferred.push_back(hasEnglish ? "en" : bundle.localizations.front());
  }
  return bundle;
}

std::string StringsTablePath(const Bundle& bundle, const std::string& table,
                             const std::string& localization) {
  if (table.find('/') != std::string::npos || localization.find('/') != std::string::npos) {
    return {};
  }
  const std::string path =
      bundle.path + "/" + localization + std::string(kSuffix) + "/" + table + ".strings";
  struct stat info {};
  if (stat(path.c_str(), &info) != 0 || !S_ISREG(info.st_mode)) return {};
  return path;
}

}  // namespace tarvod
