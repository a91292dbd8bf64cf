// Rule processing: decide whether a rule fires, then its variables, then its actions.

#include "engine/rule_processor.h"

#include <optional>
#include <string>

#include "engine/rules_loader.h"
#include "platform/diagnostic_log.h"
#include "platform/serial_queue.h"

namespace tarvod {
namespace {

enum class Mode { kAny, kAll, kNone };

// Assigns every entry of a variables dictionary, keys in ascending byte order, so that a value
// may refer to a name that sorts before it and see the value just set.
void AssignVariables(const plist::Dictionary& variables, const std::string& filePath,
                     Context& context) {
  for (const std::string& key : variables.sortedKeys()) {
    context.setVariableValue(*variables.find(key), key, filePath);
  }
}

// One criterion entry. An entry that is not a dictionary has no operator: it fails with the
// message of an invalid operator.
bool EvaluateEntry(const plist::Value& entry, const Rule& rule, Context& context) {
  if (const plist::Dictionary* criterion = entry.asDictionary()) {
    return ProcessCriteria(*criterion, rule, context);
  }
  LogMessage(0, "The operator %s is invalid in the criteria:\n%s", "(null)",
             plist::Describe(entry).c_str());
  return false;
}

}  // namespace

bool ProcessRule(const Rule& rule, Context& context) {
  const plist::Value* nameValue = rule.find("name");
  const plist::Value* filePathValue = rule.find("filePath");
  const std::string name = nameValue ? nameValue->textForm() : "(null)";
  const std::string filePath = filePathValue ? filePathValue->textForm() : std::string();
  LogMessage(2, "PROCESSING RULE: %s (%s)", name.c_str(),
             filePathValue ? filePath.c_str() : "(null)");
  const RuleMessageScope scope(name, filePath);
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
        const bool passed = EvaluateEntry(entry, rule, context);
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
      AssignVariables(*loaded, filePath, context);
    } else {
      LogMessage(3, "        failed to load variables from %s", path.c_str());
    }
    LogMessage(3, "    done processing variables from file");
  }
  LogMessage(3, "    processing variables from rule");
  if (const plist::Value* variables = rule.find("variables")) {
    if (const plist::Dictionary* dictionary = variables->asDictionary()) {
      AssignVariables(*dictionary, filePath, context);
    } else {
      LogMessage(0, "ProcessRule: the variables of rule %s are not a dictionary.", name.c_str());
    }
  }
  if (const plist::Array* actions = rule.findArray("actions")) {
    static const plist::Dictionary kNoAction;
    const FiredRule fired{rule, name, filePath};
    for (const plist::Value& action : *actions) {
      const plist::Dictionary* dictionary = action.asDictionary();
      ProcessAction(dictionary ? *dictionary : kNoAction, fired, context);
    }
  }
  LogMessage(2, "%s", "");
  return true;
}

}  // namespace tarvod
