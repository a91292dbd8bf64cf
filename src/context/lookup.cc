// Variable lookup, existence tests and assignment: the namespaces of a reference, its format
// suffix, and the arithmetic assignment rule.

#include "context/arithmetic.h"
#include "context/context.h"
#include "context/format_suffix.h"
#include "context/keychain.h"
#include "platform/diagnostic_log.h"

namespace tarvod {
namespace {

constexpr std::string_view kBuiltinPrefix = "builtin:";
constexpr std::string_view kEventPrefix = "event:";
constexpr std::string_view kKeychainPrefix = "keychain:";
constexpr std::string_view kGlobalPrefix = "global:";

std::optional<plist::Value> ValueIn(const plist::Dictionary* dictionary, std::string_view key) {
  if (dictionary == nullptr) return std::nullopt;
  const plist::Value* value = dictionary->find(key);
  if (value == nullptr) return std::nullopt;
  return *value;
}

// The variables dictionary of a scope (the globals or one rules file), created empty on first
// use; a non-dictionary left under the key (a damaged state file) is replaced.
plist::Dictionary* ScopeIn(VariableStore* store, std::string_view key) {
  if (store == nullptr) return nullptr;
  if (plist::Dictionary* scope = store->findDictionary(key)) return scope;
  store->set(key, plist::Dictionary());
  return store->findDictionary(key);
}

}  // namespace

std::optional<plist::Value> Context::variableValueForKey(std::string_view reference,
                                                         std::string_view rulesFile) {
  if (reference.empty()) return std::nullopt;

  // The format suffix runs from the last "%" to the end; without one, the name is taken as
  // written, blanks included.
  std::string_view name = reference;
  std::string_view suffix;
  if (const size_t percent = reference.rfind('%'); percent != std::string_view::npos) {
    name = plist::TrimSpace(reference.substr(0, percent));
    suffix = plist::TrimSpace(reference.substr(percent));
  }

  // The first matching namespace decides; there is no fallback between them, so a plain name
  // never reaches the globals.
  std::optional<plist::Value> value;
  if (name.starts_with(kBuiltinPrefix)) {
    value = valueForBuiltinVariableKey(name.substr(kBuiltinPrefix.size()));
  } else if (name.starts_with(kEventPrefix)) {
    value = ValueIn(event(), name.substr(kEventPrefix.size()));
  } else if (name.starts_with(kKeychainPrefix)) {
    if (!mKeychain) return std::nullopt;
    if (auto password = ResolveKeychain(*mKeychain, name.substr(kKeychainPrefix.size()))) {
      value = plist::Value(std::move(*password));
    }
  } else if (name.starts_with(kGlobalPrefix)) {
    if (mVariables) {
      value = ValueIn(mVariables->findDictionary(kGlobalsKey), name.substr(kGlobalPrefix.size()));
    }
  } else if (UnescapedColonsInString(name)) {
    value = ValueIn(&mEventMetadata, name);
  } else if (!rulesFile.empty() && mVariables) {
    value = ValueIn(mVariables->findDictionary(rulesFile), name);
  }

  if (suffix.empty()) return value;
  std::optional<plist::Value> formatted = ApplyFormatSuffix(value, suffix);
  // A secret read through a format suffix ("%d", "%x") is a secret in its new form too.
  if (mKeychain && value && formatted && mKeychain->isSecret(*value)) {
    mKeychain->rememberComputed(formatted->textForm());
  }
  return formatted;
}

bool Context::keyExists(std::string_view reference, std::string_view rulesFile) {
  const bool exists = variableValueForKey(reference, rulesFile).has_value();
  const std::string shown = shownText(reference);
  LogMessage(6, "KeyExists: %s %s in the datastore", shown.c_str(),
             exists ? "exists" : "does not exist");
  return exists;
}

void Context::setVariableValue(const std::optional<plist::Value>& value, std::string_view name,
                               std::string_view rulesFile) {
  ErrorSlot error;
  const std::optional<plist::Value> resolvedName =
      resolveVariablesInString(std::string(name), rulesFile, &error);
  if (error) {
    LogMessage(0, "Error: %s", error->description.c_str());
    return;
  }
  if (!resolvedName || !resolvedName->isString()) {
    LogMessage(0, "The variable name %s is not a string. Skipping.",
               shownValue(resolvedName).c_str());
    return;
  }
  std::string_view variable = resolvedName->string();
  const bool global = variable.starts_with(kGlobalPrefix);
  if (global) variable.remove_prefix(kGlobalPrefix.size());
  if (UnescapedColonsInString(variable)) {
    const std::string shown = shownText(variable);
    LogMessage(0, "Variable names cannot contain \":\" - skipping %s", shown.c_str());
    return;
  }

  std::optional<plist::Value> stored = value;
  if (value && value->isString()) {
    if (DebugLevel() >= 4) {
      LogMessage(4, "initial value = %s", shownText(value->string()).c_str());
    }
    stored = resolveVariablesInString(value->string(), rulesFile, &error);
    if (error) {
      LogMessage(0, "Error: %s", error->description.c_str());
      return;
    }
    if (DebugLevel() >= 4) {
      LogMessage(4, "after resolveVarsInString value = %s", shownValue(stored).c_str());
    }
    // Purely arithmetic text becomes its number; the character test keeps ordinary text away
    // from the evaluator.
    if (stored && stored->isString() && IsArithmeticCandidate(stored->string())) {
      ArithmeticResult result = EvaluateArithmetic(stored->string());
      if (result.value) {
        // The number computed from a secret is a secret too.
        if (mKeychain && mKeychain->isSecret(*stored)) {
          mKeychain->rememberComputed(result.value->textForm());
        }
        stored = std::move(result.value);
      } else {
        LogMessage(4, "Exception thrown while evaluating expression: %s\n%s\n",
                   shownText(stored->string()).c_str(), shownText(result.failure).c_str());
      }
    }
  }

  const std::string key(variable);
  plist::Dictionary* scope = nullptr;
  if (global) {
    scope = ScopeIn(mVariables.get(), kGlobalsKey);
  } else if (rulesFile.empty()) {
    LogMessage(1, "Cannot set file local variable %s because the file path is nil",
               shownText(key).c_str());
  } else {
    scope = ScopeIn(mVariables.get(), rulesFile);
  }
  // The text form is taken before the value moves into the store, and only when it is shown.
  const std::string shown = DebugLevel() >= 3 ? shownValue(stored) : std::string();
  if (scope != nullptr) {
    if (stored) {
      scope->set(key, std::move(*stored));
    } else {
      scope->erase(key);
    }
  }
  if (DebugLevel() >= 3) {
    LogMessage(3, "  Set variable: %s = %s", shownText(key).c_str(), shown.c_str());
  }
}

}  // namespace tarvod
