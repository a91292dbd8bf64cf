#include "actions/log_action.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

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

// Seeks to the end of fd (unless it was opened to append) and writes the message and one
// newline with one call (so that no other writer's bytes can come between them); a short write
// is reported as the two writes of the line would have reported it, and the newline is still
// attempted. False when any of the line is missing.
bool WriteLine(int fd, const std::string& path, const std::string& message, bool seek = true) {
  if (seek) lseek(fd, 0, SEEK_END);
  iovec parts[2] = {{const_cast<char*>(message.data()), message.size()},
                    {const_cast<char*>("\n"), 1}};
  errno = 0;
  const ssize_t written = writev(fd, parts, 2);
  const size_t done = written < 0 ? 0 : static_cast<size_t>(written);
  if (done == message.size() + 1) return true;
  if (done < message.size()) {
    LogMessage(0, "LOG: Cannot write to %s errno = %d", path.c_str(), errno);
  }
  errno = 0;
  if (write(fd, "\n", 1) != 1) {
    LogMessage(0, "LOG: Cannot write to %s errno = %d", path.c_str(), errno);
  }
  return false;
}

void LogToFile(const std::string& path, const std::string& message) {
  // Neither truncated nor appending: the seek to the end is what places the line.
  const int fd = OpenLogDestination(path.c_str(), O_CREAT, 0644);
  if (fd < 0) {
    LogMessage(0, "LOG: Cannot open %s errno = %d", path.c_str(), errno);
    return;
  }
  WriteLine(fd, path, message);
  close(fd);
}

// ---- kept files (keepLogFilesOpen) ----

std::atomic<bool> gKeepLogFilesOpen{false};
std::atomic<uint64_t> gReopenGeneration{0};
std::atomic<uint64_t> gBatch{0};

struct KeptFile {
  std::string path;
  int fd = -1;
  dev_t device = 0;
  ino_t inode = 0;
  uint64_t checkedInBatch = 0;
  uint64_t lastUse = 0;
};

// The open files; actions run on the processing queue, the lock only keeps the table sound
// should another thread ever write a line.
class KeptFiles {
 public:
  // The descriptor for path, opened when needed; -1 with errno set when it cannot be opened.
  int get(const std::string& path) {
    const uint64_t generation = gReopenGeneration.load(std::memory_order_relaxed);
    if (generation != mGeneration) {
      closeAll();
      mGeneration = generation;
    }
    const uint64_t batch = gBatch.load(std::memory_order_relaxed);
    ++mUses;
    for (size_t i = 0; i < mFiles.size(); ++i) {
      KeptFile& file = mFiles[i];
      if (file.path != path) continue;
      if (file.checkedInBatch != batch) {
        // Rotated (renamed, removed, replaced) since the last batch: write to what the path
        // names now.
        struct stat named {};
        if (stat(path.c_str(), &named) != 0 || named.st_dev != file.device ||
            named.st_ino != file.inode) {
          drop(i);
          break;
        }
        file.checkedInBatch = batch;
      }
      file.lastUse = mUses;
      return file.fd;
    }
    // Appending: every line lands at the end without a seek of its own, even after another
    // writer has added to the file.
    const int fd = OpenLogDestination(path.c_str(), O_CREAT | O_APPEND, 0644);
    if (fd < 0) return -1;
    struct stat opened {};
    if (fstat(fd, &opened) != 0) {
      const int error = errno;
      close(fd);
      errno = error;
      return -1;
    }
    if (mFiles.size() >= kMaxKeptLogFiles) {
      size_t oldest = 0;
      for (size_t i = 1; i < mFiles.size(); ++i) {
        if (mFiles[i].lastUse < mFiles[oldest].lastUse) oldest = i;
      }
      drop(oldest);
    }
    mFiles.push_back(KeptFile{path, fd, opened.st_dev, opened.st_ino, batch, mUses});
    return fd;
  }

  // After a failed write: the next line opens the path again.
  void forget(int fd) {
    for (size_t i = 0; i < mFiles.size(); ++i) {
      if (mFiles[i].fd == fd) {
        drop(i);
        return;
      }
    }
  }

  std::mutex& lock() { return mLock; }

 private:
  void drop(size_t i) {
    close(mFiles[i].fd);
    mFiles[i] = std::move(mFiles.back());
    mFiles.pop_back();
  }
  void closeAll() {
    for (const KeptFile& file : mFiles) close(file.fd);
    mFiles.clear();
  }

  std::mutex mLock;
  std::vector<KeptFile> mFiles;
  uint64_t mGeneration = 0;
  uint64_t mUses = 0;
};

KeptFiles& Kept() {
  static auto* const kept = new KeptFiles;  // outlives every queue thread
  return *kept;
}

// The same bytes as LogToFile, into a kept file opened to append.
void LogToKeptFile(const std::string& path, const std::string& message) {
  KeptFiles& kept = Kept();
  std::lock_guard<std::mutex> guard(kept.lock());
  const int fd = kept.get(path);
  if (fd < 0) {
    LogMessage(0, "LOG: Cannot open %s errno = %d", path.c_str(), errno);
    return;
  }
  if (WriteLine(fd, path, message, false)) return;
  kept.forget(fd);
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

void SetKeepLogFilesOpen(bool keep) {
  gKeepLogFilesOpen.store(keep);
  ReopenKeptLogFiles();
}

void ReopenKeptLogFiles() { gReopenGeneration.fetch_add(1); }

void EndLogBatch() { gBatch.fetch_add(1, std::memory_order_relaxed); }

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
  if (gKeepLogFilesOpen.load(std::memory_order_relaxed)) {
    LogToKeptFile(*line->path, message);
  } else {
    LogToFile(*line->path, message);
  }
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
