// Action dispatch: an action's type keyword selects its handler through the action table.

#include <string>

#include "actions/log_action.h"
#include "engine/keyword_tables.h"
#include "engine/rule_processor.h"
#include "platform/diagnostic_log.h"

namespace tarvod {
namespace {

enum ActionCodes : int {
  kNullAction = 0,
  kLog = 3,
  kSendEmail = 4,
  kSendMessage = 5,
  kSendQe = 6,
  kPostNotification = 7,
  kSendPage = 8,
  kSendSms = 9,
  kRunCommand = 10,
  kAddToDb = 11,
  kPublishRss = 12,
  kDebugDump = 13,
};

std::string LowerCase(std::string text) {
  for (char& c : text) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  }
  return text;
}

// "data" selects what is written; the comparison is exact, so "All" writes nothing.
void DebugDump(const plist::Dictionary& action, const Rule& rule, Context& context) {
  const std::string* data = action.findString("data");
  if (data == nullptr) return;
  if (*data == "all") {
    LogMessage(2, "inAction = %s", plist::Describe(action).c_str());
    LogMessage(2, "inRule = %s", plist::Describe(rule).c_str());
    LogMessage(2, "inContext = %s", context.description().c_str());
  } else if (*data == "globals") {
    const std::string text =
        context.variables() ? plist::Describe(*context.variables()) : std::string("(nil)");
    LogMessage(2, "Globals = %s", text.c_str());
  } else if (*data == "rulebase") {
    const std::string text = context.rulebase()
                                 ? plist::Describe(RulebaseToValue(*context.rulebase()))
                                 : std::string("(nil)");
    LogMessage(2, "Rulebase = %s", text.c_str());
  }
}

}  // namespace

void ProcessAction(const plist::Dictionary& action, const Rule& rule, Context& context) {
  const plist::Value* type = action.find("type");
  const std::string written = type ? type->textForm() : "(null)";
  const long code = type ? ActionCode(LowerCase(written)).value_or(kNullAction) : kNullAction;
  LogMessage(2, "  Executing action %s (%ld)", written.c_str(), code);

  switch (code) {
    case kLog:
      DoLogAction(action, rule, context);
      break;
    case kDebugDump:
      DebugDump(action, rule, context);
      break;
    case kSendEmail:
    case kSendPage:
    case kSendSms:
    case kPostNotification:
    case kRunCommand:
      // The mail, notification and command handlers are not part of this build yet; until
      // they are, these keywords are accepted and do nothing.
      break;
    case kNullAction:
    case kSendMessage:
    case kSendQe:
    case kAddToDb:
    case kPublishRss:
    default:
      break;
  }
  LogMessage(2, "%s", "");
}

}  // namespace tarvod
