// Localization bundles on disk: a directory holding one "<language>.lproj" directory per
// localization, each with "<table>.strings" files. Any thread; nothing is cached here.
#pragma once

#include <optional>
#include <string>
#include <vector>

namespace tarvod {

struct Bundle {
  std::string path;
  // The names of the .lproj directories without the suffix, sorted by name.
  std::vector<std::string> localizations;
  // Those matching LC_MESSAGES or LANG, else the default localization ("en" when present,
  // else the first by name); empty only when the bundle has no localization.
  std::vector<std::string> preferred;
};

// The bundle at path; nullopt when path is no directory that can be listed.
std::optional<Bundle> OpenBundle(const std::string& path);

// The localizations that match the preferences, in their order: for each preferred code,
// the localization of the same name, then those whose language part (before "_" or "-") is
// that code, so "fr" matches "fr_CA".
std::vector<std::string> OrderLocalizations(const std::vector<std::string>& localizations,
                                            const std::vector<std::string>& preferences);

// "<path>/<localization>.lproj/<table>.strings" when it is a regular file; empty otherwise.
std::string StringsTablePath(const Bundle& bundle, const std::string& table,
                             const std::string& localization);

}  // namespace tarvod
