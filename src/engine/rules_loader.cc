#include "engine/rules_loader.h"

#include <algorithm>
#include <filesystem>
#include <system_error>

#include "context/context.h"
#include "platform/diagnostic_log.h"
#include "plist/codec.h"

namespace tarvod {
namespace {

namespace fs = std::filesystem;

std::string RuleName(const plist::Dictionary& rule) {
  const plist::Value* name = rule.find("name");
  return name ? name->textForm() : "(null)";
}

// Assigns a rule's "eval on load" variables, keys in ascending order.
void AssignLoadTimeVariables(const VariableStorePtr& variables, const std::string& variablesPath,
                             const std::string& rulesFile,
                             const std::shared_ptr<Keychain>& keychain) {
  LogMessage(3, "  preparing the \"eval on load\" vairables (from path %s)", variablesPath.c_str());
  if (std::optional<plist::Dictionary> loaded = LoadVariablesFile(variablesPath)) {
    // The rulebase is still being built: the context has none to show.
    Context context(variables, nullptr, keychain);
    for (const std::string& key : loaded->sortedKeys()) {
      context.setVariableValue(*loaded->find(key), key, rulesFile);
    }
  }
  LogMessage(3, "  finished with the \"eval on load\" vairables");
}

// Copies editors and package managers leave beside the file they replace: loading them would
// run an old rule next to its new version.
bool IsLeftover(std::string_view name) {
  for (const std::string_view ending :
       {"~", ".swp", ".dpkg-old", ".dpkg-new", ".dpkg-dist", ".rpmsave", ".rpmnew"}) {
    if (name.ends_with(ending)) return true;
  }
  return false;
}

}  // namespace

std::optional<plist::Dictionary> LoadVariablesFile(const std::string& path) {
  std::optional<plist::Value> file = plist::ReadPropertyListFile(path);
  if (!file || !file->isDictionary()) {
    LogMessage(4, "ERROR: Unable to load vairables from %s", path.c_str());
    return std::nullopt;
  }
  return std::move(file->dictionary());
}

size_t LoadRulesFile(Rulebase& rulebase, const VariableStorePtr& variables, const std::string& path,
                     const std::shared_ptr<Keychain>& keychain, LoadReport* report) {
  std::optional<plist::Value> file = plist::ReadPropertyListFile(path);
  if (!file || !file->isArray()) {
    if (report) {
      ++report->filesSkipped;
      report->add(FileProblem(path, file ? "the top level is not an array of rules; skipped"
                                         : "cannot be read as a property list; skipped"));
    }
    return 0;
  }
  LogMessage(2, "LOADING RULES (%s)", path.c_str());
  size_t accepted = 0;
  size_t index = 0;
  for (plist::Value& element : file->array()) {
    if (report) CheckRule(element, path, ++index, report->problems);
    plist::Dictionary* source = element.asDictionary();
    if (!source) continue;
    const plist::Array* eventTypes = source->findArray("eventTypes");
    if (!eventTypes) continue;
    const std::string name = RuleName(*source);
    if (const plist::Value* enabled = source->find("enabled"); enabled && !enabled->boolValue()) {
      LogMessage(3, "  Skipping disabled rule: %s", name.c_str());
      continue;
    }
    // Copied before filePath is added: adding a key may move the entries eventTypes points into.
    const plist::Array types = *eventTypes;
    source->set("filePath", plist::Value(path));
    if (const plist::Value* loadWith = source->find("loadVariablesWithRule")) {
      AssignLoadTimeVariables(variables, loadWith->textForm(), path, keychain);
    }
    auto rule = std::make_shared<const Rule>(std::move(*source));
    for (const plist::Value& type : types) {
      // Types are matched as exact strings. Anything else in the list is skipped: indexed
      // under its text form, 5 or a nested array would match events of that type.
      // (CheckRule reports it.)
      if (!type.isString()) continue;
      rulebase[type.string()].rules.push_back(rule);
      LogMessage(3, "  Added rule: %s", name.c_str());
    }
    ++accepted;
  }
  LogMessage(2, "%s", "");
  if (report) {
    ++report->filesRead;
    report->rulesLoaded += accepted;
  }
  return accepted;
}

size_t LoadRulesDirectory(Rulebase& rulebase, const VariableStorePtr& variables,
                          const std::string& path, const std::shared_ptr<Keychain>& keychain,
                          LoadReport* report) {
  LogMessage(3, "Loading rules files from %s\n", path.c_str());
  // Entries are visited depth first, each directory's entries sorted by name, so that the
  // order rules run in does not depend on how the file system happens to list them.
  std::vector<std::string> pending{path};
  size_t total = 0;
  while (!pending.empty()) {
    const std::string directory = std::move(pending.back());
    pending.pop_back();
    std::error_code error;
    std::vector<fs::directory_entry> entries;
    for (fs::directory_iterator it(directory, error), end; !error && it != end;
         it.increment(error)) {
      entries.push_back(*it);
    }
    std::sort(entries.begin(), entries.end(), [](const auto& a, const auto& b) {
      return a.path().filename() < b.path().filename();
    });
    std::vector<std::string> subdirectories;
    for (const fs::directory_entry& entry : entries) {
      std::string entryPath = directory;
      if (entryPath.empty() || entryPath.back() != '/') entryPath += '/';
      entryPath += entry.path().filename().string();
      std::error_code typeError;
      if (entry.is_directory(typeError) && !entry.is_symlink(typeError)) {
        subdirectories.push_back(entryPath);
        continue;
      }
      if (IsLeftover(entryPath)) {
        if (report) {
          ++report->filesSkipped;
          report->add(FileProblem(entryPath, "an editor's or package manager's leftover; skipped",
                                  Problem::Severity::kWarning));
        }
        continue;
      }
      total += LoadRulesFile(rulebase, variables, entryPath, keychain, report);
    }
    // Pushed in reverse so the first subdirectory is walked first.
    for (auto it = subdirectories.rbegin(); it != subdirectories.rend(); ++it) {
      pending.push_back(*it);
    }
  }
  return total;
}

}  // namespace tarvod
