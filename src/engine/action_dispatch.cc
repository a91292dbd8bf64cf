// Action dispatch: an action's type keyword selects its handler through the action table.

#include <string>

#include "actions/debug_dump.h"
#include "actions/log_action.h"
#include "actions/post_notification.h"
#include "actions/run_command_action.h"
#include "actions/send_email_action.h"
#include "engine/keyword_tables.h"
#include "engine/rule_processor.h"
#include "engine/stats.h"
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

RunCommandAction& RunCommandHandler() {
  static RunCommandAction runCommand(ProcessLauncher::Real());
  return runCommand;
}

// The mail handlers: normal mode, and the short-message mode of pages and text messages.
SendEmailAction& MailHandler(bool shortMessage) {
  static SendEmailAction mail(ProcessLauncher::Real(), false);
  static SendEmailAction shortMail(ProcessLauncher::Real(), true);
  return shortMessage ? shortMail : mail;
}

// The handler of an action code; nullptr for the keywords that do nothing (sendmessage,
// sendqe, addtodb and publishrss have none).
Action* HandlerFor(long code) {
  static LogAction log;
  static DebugDumpAction debugDump;
  static PostNotificationAction postNotification(NotificationCenter::Default());
  switch (code) {
    case kLog:
      return &log;
    case kSendEmail:
      return &MailHandler(false);
    case kSendPage:
    case kSendSms:
      return &MailHandler(true);
    case kRunCommand:
      return &RunCommandHandler();
    case kPostNotification:
      return &postNotification;
    case kDebugDump:
      return &debugDump;
    default:
      return nullptr;
  }
}

}  // namespace

void SetDefaultCommandTimeout(double seconds) {
  RunCommandHandler().setDefaultTimeout(seconds);
  MailHandler(false).setTimeout(seconds);
  MailHandler(true).setTimeout(seconds);
}

void SetMailPrograms(const std::string& local, const std::string& relay) {
  MailHandler(false).setPrograms(MailPrograms{local, relay});
  MailHandler(true).setPrograms(MailPrograms{local, relay});
}

void ProcessAction(const plist::Dictionary& action, const FiredRule& rule, Context& context,
                   DryRun* dryRun) {
  const plist::Value* type = action.find("type");
  const std::string written = type ? type->textForm() : "(null)";
  const long code = type ? ActionCode(LowerCase(written)).value_or(kNullAction) : kNullAction;
  LogMessage(2, "  Executing action %s (%ld)", written.c_str(), code);
  Action* handler = HandlerFor(code);
  if (dryRun != nullptr) {
    const std::optional<std::string> described =
        handler ? handler->describe(action, rule, context) : std::string("does nothing");
    dryRun->note("  action %s: %s", written.c_str(),
                 described ? described->c_str() : "fails (see the message above)");
  } else if (handler) {
    const uint64_t problems = RuleProblemCount();
    handler->perform(action, rule, context);
    Statistics().actionRan(code, RuleProblemCount() != problems);
  }
  LogMessage(2, "%s", "");
}

}  // namespace tarvod
