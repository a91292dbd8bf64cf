// Context: the evaluation context of one event (or of one rule's load-time variables). It
// holds a flattened copy of the event, the shared variable store and rulebase, the per-event
// metadata and, from the first "system:" lookup on, a memory-statistics snapshot. Every
// variable lookup, assignment and substitution goes through a context.
//
// A context is used by one thread at a time (the processing queue, or the main thread while
// rules load at startup); it takes no locks. Failures are values: lookups return nullopt,
// substitutions set the caller's error slot.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "context/keychain.h"
#include "context/types.h"
#include "platform/host_stats.h"
#include "plist/value.h"

namespace tarvod {

// The error object of a failed substitution: domain "com.quenta.tarvod", code 1.
struct SubstitutionError {
  std::string domain = "com.quenta.tarvod";
  int code = 1;
  std::string description;  // the collected messages joined by line feeds
};
// The caller's error slot: initialise to nullopt before a call; set only on failure.
using ErrorSlot = std::optional<SubstitutionError>;

class Context {
 public:
  // initWithVariables:andRulebase: / initWithVariables:andRulebase:andEvent:. Without a
  // keychain, "keychain:" references have no value.
  Context(VariableStorePtr variables, RulebasePtr rulebase,
          std::shared_ptr<Keychain> keychain = nullptr);
  Context(VariableStorePtr variables, RulebasePtr rulebase, const plist::Dictionary& event,
          std::shared_ptr<Keychain> keychain = nullptr);
  ~Context();
  Context(const Context&) = delete;
  Context& operator=(const Context&) = delete;

  const VariableStorePtr& variables() const { return mVariables; }
  const RulebasePtr& rulebase() const { return mRulebase; }
  // The imported event; nullptr for a context made without one.
  const plist::Dictionary* event() const { return mEvent ? &*mEvent : nullptr; }
  plist::Dictionary& eventMetadata() { return mEventMetadata; }
  // Imports an event: details lifted to the top level with their string values'
  // colons escaped, then the top-level keys other than eventDetails, unescaped.
  void setEvent(const plist::Dictionary& event);

  // The statistics snapshot, taken at the first call; nullptr when the host query failed.
  const StatContext* stats();

  // Lookup, existence and assignment. rulesFile is the rule's filePath; empty means none.
  std::optional<plist::Value> variableValueForKey(std::string_view reference,
                                                  std::string_view rulesFile);
  bool keyExists(std::string_view reference, std::string_view rulesFile);
  // An absent value removes the variable.
  void setVariableValue(const std::optional<plist::Value>& value, std::string_view name,
                        std::string_view rulesFile);
  std::optional<plist::Value> valueForBuiltinVariableKey(std::string_view key);

  // Substitution of "${name}" references. A text that is one whole reference yields the
  // referenced value itself (any kind) or nullopt; nullopt with the slot set on failure.
  std::optional<plist::Value> resolveVariablesInString(const std::string& text,
                                                       std::string_view rulesFile,
                                                       ErrorSlot* error);
  std::optional<plist::Value> resolveVariablesInArray(const plist::Array& array,
                                                      std::string_view rulesFile, ErrorSlot* error);
  std::optional<plist::Value> resolveVariablesInDictionary(const plist::Dictionary& dictionary,
                                                           std::string_view rulesFile,
                                                           ErrorSlot* error);
  std::optional<plist::Value> resolveVariablesInObject(const plist::Value& value,
                                                       std::string_view rulesFile,
                                                       ErrorSlot* error);

  // What traces, dumps and log lines print: the text, or a value's text form (nullopt is
  // "(null)"), with every secret text of the keychain shown as kSecretPlaceholder.
  std::string shownText(std::string_view text) const;
  std::string shownValue(const plist::Value& value) const;
  std::string shownValue(const std::optional<plist::Value>& value) const;
  // The variable store's text form, shown as above.
  std::string variablesDescription() const;

  // "event = ... \n variables = ... \n rulebase = ..." with the text forms of the three.
  std::string description() const;

 private:
  VariableStorePtr mVariables;
  RulebasePtr mRulebase;
  std::shared_ptr<Keychain> mKeychain;
  std::optional<plist::Dictionary> mEvent;
  plist::Dictionary mEventMetadata;
  std::unique_ptr<StatContext> mStats;
  bool mStatsTaken = false;
  // Arrays and dictionaries being resolved around the current one; bounds the recursion.
  int mResolveDepth = 0;
};

// The colon-escape convention: a colon is escaped when the run of backslashes right before it
// has odd length.
std::string EscapeColonsInEventString(std::string_view text);
std::string UnescapeColonsInString(std::string_view text);
bool UnescapedColonsInString(std::string_view text);

}  // namespace tarvod
