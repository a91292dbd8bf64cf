#include "actions/log_action.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "platform/diagnostic_log.h"
#include "platform/serial_queue.h"
#include "platform/structured_log.h"

namespace tarvod {
namespace {

using LevelTable = std::array<std::pair<std::string_view, int>, 8>;

constexpr int kNoticeSeverity = 5;

// The syslog severities, in the order the complaint about a bad level lists them.
const LevelTable* gLevelNames = nullptr;

const LevelTable& LevelNames() {
  BuildLevelNameTable();
  return *gLevelNames;
}

std::string LowerCase(std::string text) {
  for (char& c : text) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  }
  return text;
}

// The severity a logLevel value names. A name outside the table is treated like a value that
// is no string at all (the complaint, then notice): reading a missing entry as 0 would turn a
// misspelt "warnig" into an emergency.
int Severity(const plist::Value* logLevel) {
  if (logLevel != nullptr && logLevel->isString()) {
    const std::string name = LowerCase(logLevel->string());
    for (const auto& [levelName, severity] : LevelNames()) {
      if (levelName == name) return severity;
    }
  }
  std::string valid;
  for (const auto& [levelName, severity] : LevelNames()) {
    if (!valid.empty()) valid += ", ";
    valid += levelName;
  }
  LogMessage(0,
             "The value for %s is not a valid level string. Using notice level. Valid strings "
             "are:\n%s",
             "logLevel", valid.c_str());
  return kNoticeSeverity;
}

void LogToStructuredLog(const plist::Dictionary& action, const std::string& logType,
                        const std::string& message, const FiredRule& rule, Context& context) {
  LogAttributes attributes;
  if (const plist::Value* facility = action.find("facility")) {
    attributes.emplace_back("Facility", facility->textForm());
  }
  if (logType == "kvlog") {
    if (const plist::Value* details = action.find("details")) {
      if (!details->isDictionary()) {
        LogMessage(0, "The value for %s is not a dictionary. Aborting log action.", "details");
        return;
      }
      const std::optional<std::optional<plist::Value>> resolved =
          ResolveActionValue(action, "details", rule, context);
      if (!resolved) return;
      if (*resolved && (*resolved)->isDictionary()) {
        // The details' keys are unique, so only the facility can share a name with one: the
        // later value replaces it in place, as in event records.
        const bool hasFacility = !attributes.empty();
        for (const auto& [key, value] : (*resolved)->dictionary()) {
          if (hasFacility && key == attributes.front().first) {
            attributes.front().second = context.shownValue(value);
          } else {
            attributes.emplace_back(context.shownText(key), context.shownValue(value));
          }
        }
      }
    }
  }
  const int severity = Severity(action.find("logLevel"));
  // The message travels as data, never as a format: "%" in it reaches the log unchanged.
  bool sent;
  {
    SerialQueue::BlockingSection blocking;
    sent = DefaultStructuredLog().send(severity, message, attributes);
  }
  if (!sent) {
    LogMessage(0, "DoLogAction: Cannot send message to the structured log");
  }
}

void LogToFile(const std::string& path, const std::string& message) {
  // Neither truncated nor appending: the seek to the end is what places the line.
  const int fd = OpenLogDestination(path.c_str(), O_CREAT, 0644);
  if (fd < 0) {
    LogMessage(0, "LOG: Cannot open %s errno = %d", path.c_str(), errno);
    return;
  }
  lseek(fd, 0, SEEK_END);
  errno = 0;
  const ssize_t written = write(fd, message.data(), message.size());
  if (written < 0 || static_cast<size_t>(written) != message.size()) {
    LogMessage(0, "LOG: Cannot write to %s errno = %d", path.c_str(), errno);
  }
  errno = 0;
  if (write(fd, "\n", 1) != 1) {
    LogMessage(0, "LOG: Cannot write to %s errno = %d", path.c_str(), errno);
  }
  close(fd);
}

}  // namespace

void BuildLevelNameTable() {
  static std::once_flag once;
  std::call_once(once, [] {
    static const LevelTable table = {{
        {"emergency", 0},
        {"alert", 1},
        {"critical", 2},
        {"error", 3},
        {"warning", 4},
        {"notice", 5},
        {"info", 6},
        {"debug", 7},
    }};
    gLevelNames = &table;
  });
}

namespace {

// What a log action writes: the message (empty: nothing), the lower-cased logType, the path.
struct LogLine {
  std::string message;
  std::string type;
  std::optional<std::string> path;
};

// nullopt when a substitution failed (logged): the action ends.
std::optional<LogLine> ResolveLogLine(const plist::Dictionary& action, const FiredRule& rule,
                                      Context& context) {
  LogLine line;
  const auto resolvedMessage = ResolveActionText(action, "message", rule, context);
  if (!resolvedMessage) return std::nullopt;
  if (!*resolvedMessage || (*resolvedMessage)->empty()) return line;
  // A log line is no place for a secret: keychain values are written as the placeholder.
  line.message = context.shownText(UnescapeColonsInString(**resolvedMessage));
  if (line.message.empty()) return line;

  const auto logType = ResolveActionText(action, "logType", rule, context);
  if (!logType) return std::nullopt;
  line.type = *logType ? LowerCase(**logType) : std::string();

  // Resolved even for the structured log: an error in it ends the action either way.
  const auto logPath = ResolveActionText(action, "logPath", rule, context);
  if (!logPath) return std::nullopt;
  line.path = *logPath;
  return line;
}

}  // namespace

void LogAction::perform(const plist::Dictionary& action, const FiredRule& rule, Context& context) {
  const std::optional<LogLine> line = ResolveLogLine(action, rule, context);
  if (!line || line->message.empty()) return;
  const std::string& message = line->message;
  const std::string& type = line->type;

  LogMessage(3, "DoLogAction: logMessage is [%s]", message.c_str());

  if (type == "syslog" || type == "kvlog") {
    LogToStructuredLog(action, type, message, rule, context);
    return;
  }
  if (!line->path) return;
  // A slow or stuck file must not keep shutdown from saving the store.
  SerialQueue::BlockingSection blocking;
  LogToFile(*line->path, message);
}

std::optional<std::string> LogAction::describe(const plist::Dictionary& action,
                                               const FiredRule& rule, Context& context) {
  const std::optional<LogLine> line = ResolveLogLine(action, rule, context);
  if (!line) return std::nullopt;
  if (line->message.empty()) return std::string("would log nothing: the message is empty");
  if (line->type == "syslog" || line->type == "kvlog") {
    const plist::Value* level = action.find("logLevel");
    return "would send to the structured log (" + line->type + ", level " +
           (level ? level->textForm() : std::string("notice")) + "): " + line->message;
  }
  if (!line->path) return std::string("would log nothing: no logPath");
  return "would append to " + *line->path + ": " + line->message;
}

}  // namespace tarvod
