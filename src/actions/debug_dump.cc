#include "actions/debug_dump.h"

#include "platform/diagnostic_log.h"

namespace tarvod {

// "data" selects what is written; the comparison is exact, so "All" writes nothing.
void DebugDumpAction::perform(const plist::Dictionary& action, const FiredRule& rule,
                              Context& context) {
  const std::string* data = action.findString("data");
  if (data == nullptr) return;
  if (*data == "all") {
    LogMessage(2, "inAction = %s", plist::Describe(action).c_str());
    LogMessage(2, "inRule = %s", plist::Describe(rule.rule).c_str());
    LogMessage(2, "inContext = %s", context.description().c_str());
  } else if (*data == "globals") {
    const std::string text = context.variables() ? context.variablesDescription() : "(nil)";
    LogMessage(2, "Globals = %s", text.c_str());
  } else if (*data == "rulebase") {
    const std::string text = context.rulebase()
                                 ? plist::Describe(RulebaseToValue(*context.rulebase()))
                                 : std::string("(nil)");
    LogMessage(2, "Rulebase = %s", text.c_str());
  }
}

}  // namespace tarvod
