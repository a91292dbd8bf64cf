// Rule processing: decide whether a rule fires, then its variables, then its actions.

#include "engine/rule_processor.h"

#include <cstdarg>
#include <cstdio>
#include <optional>
#include <string>

#include "engine/rules_loader.h"
#include "platform/diagnostic_log.h"
#include "platform/serial_queue.h"

namespace tarvod {
namespace {

enum class Mode { kAny, kAll, kNone };

// A rule's text entry: the string itself when it is one (no copy per event), else its text
// form, or absent when there is none, kept in storage.
const std::string& TextOf(const plist::Value* value, std::string& storage, const char* absent) {
  if (value != nullptr) {
    if (const std::string* text = value->asString()) return *text;
    return storage = value->textForm();
  }
  return storage = absent;
}

// Assigns every entry of a variables dictionary, keys in ascending byte order, so that a value
// may refer to a name that sorts before it and see the value just set.
void AssignVariables(const plist::Dictionary& variables, const std::string& filePath,
                     Context& context, DryRun* dryRun) {
  for (const std::string& key : variables.sortedKeys()) {
    context.setVariableValue(*variables.find(key), key, filePath);
    if (dryRun) {
      // The name may itself hold references ("failures_${event:clientIP}").
      const std::optional<plist::Value> name =
          context.resolveVariablesInString(key, filePath, nullptr);
      const std::string shownName = name ? name->textForm() : key;
      dryRun->note("  sets %s = %s", shownName.c_str(),
                   context.shownValue(context.variableValueForKey(shownName, filePath)).c_str());
    }
  }
}

// One criterion entry. An entry that is not a dictionary has no operator: it fails with the
// message of an invalid operator.
bool EvaluateEntry(const plist::Value& entry, const Rule& rule, Context& context, DryRun* dryRun) {
  if (const plist::Dictionary* criterion = entry.asDictionary()) {
    return ProcessCriteria(*criterion, rule, context, dryRun);
  }
  if (dryRun) dryRun->note("  criterion: not a dictionary: failed");
  LogMessage(0, "The operator %s is invalid in the criteria:\n%s", "(null)",
             plist::Describe(entry).c_str());
  return false;
}

}  // namespace

void DryRun::note(const char* format, ...) {
  char buffer[kMaxLogMessageBytes + 1];
  va_list args;
  va_start(args, format);
  std::vsnprintf(buffer, sizeof buffer, format, args);
  va_end(args);
  lines.emplace_back(buffer);
}

bool ProcessRule(const Rule& rule, Context& context, DryRun* dryRun) {
  const plist::Value* nameValue = rule.find("name");
  const plist::Value* filePathValue = rule.find("filePath");
  std::string nameStorage;
  std::string filePathStorage;
  const std::string& name = TextOf(nameValue, nameStorage, "(null)");
  const std::string& filePath = TextOf(filePathValue, filePathStorage, "");
  LogMessage(2, "PROCESSING RULE: %s (%s)", name.c_str(),
             filePathValue ? filePath.c_str() : "(null)");
  const RuleMessageScope scope(name, filePath);
  if (dryRun) dryRun->note("rule \"%s\" (%s)", name.c_str(), filePath.c_str());
  if (DebugLevel() >= 5) LogMessage(5, "  Description:\n%s", plist::Describe(rule).c_str());

  const plist::Value* criterionValue = rule.find("criterion");
  const plist::Value* partial = rule.find("allowPartialCriterionMatch");
  bool fires = false;
  if (criterionValue != nullptr && !criterionValue->isArray()) {
    // A criterion the rule's author wrote but that is no list of entries must not turn into
    // "no criterion" and fire the rule on every event.
    LogMessage(0, "ProcessRule: the criterion of rule %s is not an array. Skipping rule.",
               name.c_str());
  } else {
    const plist::Array* entries = criterionValue ? &criterionValue->array() : nullptr;
    Mode mode = Mode::kNone;
    if (entries != nullptr && !entries->empty()) {
      mode = (partial != nullptr && partial->isBoolean() && partial->boolean()) ? Mode::kAny
                                                                                : Mode::kAll;
    }
    switch (mode) {
      case Mode::kAny:
        LogMessage(2, "  Rule will fire if any criteria passes.");
        break;
      case Mode::kAll:
        LogMessage(3, "  All criterion must pass for the rule to fire.");
        break;
      case Mode::kNone:
        LogMessage(3, "  No criterion to evaluate. Rule will fire.");
        break;
    }
    if (mode == Mode::kNone) {
      fires = true;
    } else {
      // Any: the first pass decides; all: the first failure decides. Later entries are never
      // evaluated.
      fires = mode == Mode::kAll;
      for (const plist::Value& entry : *entries) {
        const bool passed = EvaluateEntry(entry, rule, context, dryRun);
        LogMessage(2, "      %s", passed ? "Passed" : "Failed");
        if (mode == Mode::kAny && passed) {
          fires = true;
          break;
        }
        if (mode == Mode::kAll && !passed) {
          fires = false;
          break;
        }
      }
    }
  }

  if (dryRun) dryRun->note("  %s", fires ? "fires" : "does not fire");
  if (!fires) {
    LogMessage(2, "  Criterion did not pass. Skipping rule.");
    LogMessage(2, "%s", "");
    return false;
  }

  LogMessage(2, "  Criterion passed. Executing rule.");
  if (const plist::Value* fromFile = rule.find("loadVariablesFromFile")) {
    const std::string path = fromFile->textForm();
    LogMessage(3, "    processing variables from file: %s.", path.c_str());
    std::optional<plist::Dictionary> loaded;
    {
      SerialQueue::BlockingSection blocking;  // the file may be slow, or a FIFO
      loaded = LoadVariablesFile(path);
    }
    if (loaded) {
      AssignVariables(*loaded, filePath, context, dryRun);
    } else {
      LogMessage(3, "        failed to load variables from %s", path.c_str());
    }
    LogMessage(3, "    done processing variables from file");
  }
  LogMessage(3, "    processing variables from rule");
  if (const plist::Value* variables = rule.find("variables")) {
    if (const plist::Dictionary* dictionary = variables->asDictionary()) {
      AssignVariables(*dictionary, filePath, context, dryRun);
    } else {
      LogMessage(0, "ProcessRule: the variables of rule %s are not a dictionary.", name.c_str());
    }
  }
  if (const plist::Array* actions = rule.findArray("actions")) {
    static const plist::Dictionary kNoAction;
    const FiredRule fired{rule, name, filePath};
    for (const plist::Value& action : *actions) {
      const plist::Dictionary* dictionary = action.asDictionary();
      ProcessAction(dictionary ? *dictionary : kNoAction, fired, context, dryRun);
    }
  }
  LogMessage(2, "%s", "");
  return true;
}

}  // namespace tarvod
