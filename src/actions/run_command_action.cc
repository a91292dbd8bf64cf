#include "actions/run_command_action.h"

#include <fcntl.h>

#include <cstdlib>
#include <optional>
#include <string>
#include <vector>

#include "platform/diagnostic_log.h"
#include "platform/directory.h"
#include "platform/serial_queue.h"

namespace tarvod {
namespace {

constexpr uid_t kDefaultUserID = 99;
constexpr gid_t kDefaultGroupID = 99;
constexpr mode_t kOutputMode = 0640;

// The program's arguments: every string of the resolved array colon-unescaped, an array's
// elements' text forms joined with ",", anything else its text form.
std::vector<std::string> ArgumentTexts(const plist::Array& arguments) {
  std::vector<std::string> texts;
  texts.reserve(arguments.size());
  for (const plist::Value& argument : arguments) {
    if (argument.isString()) {
      texts.push_back(UnescapeColonsInString(argument.string()));
    } else if (argument.isArray()) {
      std::string joined;
      bool first = true;
      for (const plist::Value& element : argument.array()) {
        if (!first) joined += ',';
        joined += element.textForm();
        first = false;
      }
      texts.push_back(std::move(joined));
    } else {
      texts.push_back(argument.textForm());
    }
  }
  return texts;
}

// The trace line's argument list: each argument's text form in double quotes.
std::string QuotedArguments(const plist::Array& arguments) {
  std::string quoted;
  for (const plist::Value& argument : arguments) {
    if (!quoted.empty()) quoted += ' ';
    quoted += '"';
    quoted += argument.isString() ? UnescapeColonsInString(argument.string()) : argument.textForm();
    quoted += '"';
  }
  return quoted;
}

// The action's time limit in seconds (0: none); a value that is no number of seconds is
// reported and the default applies.
double TimeLimit(const std::optional<std::string>& text, double fallback) {
  if (!text) return fallback;
  char* end = nullptr;
  const double seconds = std::strtod(text->c_str(), &end);
  if (text->empty() || *end != '\0' || !(seconds >= 0) || seconds > 1e9) {
    LogMessage(0, "DoRunAction: The value for timeout is not a number of seconds: %s",
               text->c_str());
    return fallback;
  }
  return seconds;
}

Redirection Output(const std::string& path, const char* stream) {
  // Appending: each run's output arrives whole after what earlier runs wrote.
  return Redirection{-1, path, O_WRONLY | O_CREAT | O_APPEND, kOutputMode,
                     ChildMessage{std::string("DoRunAction (child): Redirect of ") + stream +
                                      " to " + path + " failed errno = ",
                                  true}};
}

}  // namespace

std::optional<RunCommandAction::Resolved> RunCommandAction::resolve(const plist::Dictionary& action,
                                                                    const FiredRule& rule,
                                                                    Context& context) {
  Resolved resolved;
  const auto command = ResolveActionText(action, "command", rule, context);
  if (!command) return std::nullopt;

  const auto resolvedArguments = ResolveActionValue(action, "arguments", rule, context);
  if (!resolvedArguments) return std::nullopt;
  plist::Array& arguments = resolved.arguments;
  if (*resolvedArguments) {
    if ((*resolvedArguments)->isArray()) {
      arguments = (*resolvedArguments)->array();
    } else {
      arguments.push_back(**resolvedArguments);
    }
  }

  const auto workingDirectory = ResolveActionText(action, "workingDirectory", rule, context);
  if (!workingDirectory) return std::nullopt;
  const auto environment = ResolveActionValue(action, "environment", rule, context);
  if (!environment) return std::nullopt;
  std::optional<std::string> paths[3];
  const char* const pathKeys[3] = {"stdinPath", "stdoutPath", "stderrPath"};
  for (int i = 0; i < 3; ++i) {
    auto path = ResolveActionText(action, pathKeys[i], rule, context);
    if (!path) return std::nullopt;
    paths[i] = *path;
  }
  const auto timeoutText = ResolveActionText(action, "timeout", rule, context);
  if (!timeoutText) return std::nullopt;

  if (!*command) {
    LogMessage(0, "DoRunAction: No command to run. Aborting action");
    return std::nullopt;
  }

  LaunchRequest& request = resolved.request;
  request.program = **command;
  request.arguments.push_back(**command);
  for (std::string& text : ArgumentTexts(arguments)) request.arguments.push_back(std::move(text));
  if (*environment && (*environment)->isDictionary() && !(*environment)->dictionary().empty()) {
    std::vector<std::string> entries;
    for (const auto& [name, value] : (*environment)->dictionary()) {
      entries.push_back(name + "=" + value.textForm());
    }
    request.environment = std::move(entries);
  }
  const std::string stdinPath = paths[0].value_or("/dev/null");
  request.redirections[0] = Redirection{
      -1, stdinPath, O_RDONLY, 0,
      ChildMessage{"DoRunAction (child): Redirect of stdin to " + stdinPath + " failed errno = ",
                   true}};
  request.redirections[1] = Output(paths[1].value_or("/dev/null"), "stdout");
  request.redirections[2] = Output(paths[2].value_or("/dev/null"), "stderr");
  if (*workingDirectory) {
    request.workingDirectory = **workingDirectory;
    request.chdirFailure = ChildMessage{
        "DoRunAction (child): chdir to " + request.workingDirectory + " failed", false};
  } else {
    request.workingDirectory = "/";
  }
  resolved.limit = TimeLimit(*timeoutText, mDefaultTimeout.load());

  // The directory service may be remote and the program may never end: nothing from here on
  // touches the variable store.
  SerialQueue::BlockingSection blocking;
  Identity identity{kDefaultUserID, kDefaultGroupID, {}};
  std::optional<std::string> userName;
  if (const plist::Value* user = action.find("user")) {
    userName = user->textForm();
    const std::optional<UserRecord> record = LookUpUser(*userName);
    if (!record) {
      LogMessage(0, "DoRunAction: User '%s' not found. Aborting action", userName->c_str());
      return std::nullopt;
    }
    identity.uid = record->uid;
  }
  if (const plist::Value* group = action.find("group")) {
    const std::string groupName = group->textForm();
    const std::optional<gid_t> gid = LookUpGroupID(groupName);
    if (!gid) {
      LogMessage(0, "DoRunAction: Group '%s' not found. Aborting action", groupName.c_str());
      return std::nullopt;
    }
    identity.gid = *gid;
  }
  // The user's groups from the group database, with the chosen group; without a user, the
  // chosen group alone, so that nothing of the daemon's own groups is passed on.
  if (userName) {
    identity.groups = GroupsOfUser(UserRecord{*userName, identity.uid, identity.gid, {}, {}});
    if (identity.groups.empty()) {
      LogMessage(0, "DoRunAction: Groups of user '%s' not found. Aborting action",
                 userName->c_str());
      return std::nullopt;
    }
  } else {
    identity.groups = {identity.gid};
  }
  request.identityFailure =
      ChildMessage{"DoRunAction (child): Change to user ID " + std::to_string(identity.uid) +
                       ", group ID " + std::to_string(identity.gid) + " failed errno = ",
                   true};
  request.identity = std::move(identity);

  return resolved;
}

std::optional<std::string> RunCommandAction::describe(const plist::Dictionary& action,
                                                      const FiredRule& rule, Context& context) {
  const std::optional<Resolved> resolved = resolve(action, rule, context);
  if (!resolved) return std::nullopt;
  const LaunchRequest& request = resolved->request;
  std::string text = "would run " + context.shownText(request.program) + " " +
                     context.shownText(QuotedArguments(resolved->arguments)) + " as user ID " +
                     std::to_string(request.identity->uid) + ", group ID " +
                     std::to_string(request.identity->gid) + ", in " + request.workingDirectory;
  if (resolved->limit > 0) text += ", for at most " + std::to_string(resolved->limit) + " s";
  return text;
}

void RunCommandAction::perform(const plist::Dictionary& action, const FiredRule& rule,
                               Context& context) {
  std::optional<Resolved> resolved = resolve(action, rule, context);
  if (!resolved) return;
  LaunchRequest& request = resolved->request;
  const plist::Array& arguments = resolved->arguments;
  const double limit = resolved->limit;
  if (DebugLevel() >= 3) {
    // An argument may carry a keychain password: the trace shows it masked.
    LogMessage(3, "    Executing command:\n      %s %s", context.shownText(request.program).c_str(),
               context.shownText(QuotedArguments(arguments)).c_str());
  }
  Result<ChildProcess> child = mLauncher.launch(request);
  if (!child.ok()) return;
  const ExitStatus status =
      WaitOrEnd(mLauncher, child.value(), limit > 0 ? std::optional<double>(limit) : std::nullopt,
                "DoRunAction", request.program, limit);
  LogMessage(3, "DoRunAction: %s exited with status %d", request.program.c_str(), status);
}

}  // namespace tarvod
