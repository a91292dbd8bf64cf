// The diagnostic log: the error log every part of the daemon writes through LogMessage, the
// event log written by LogEvent, and the console (standard error) used while the logs are
// being set up. LogMessage, LogEvent and ConsoleMessage may be called from any thread.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>

#include "plist/value.h"

namespace tarvod {

// Longest text of one message; longer messages are cut to this many bytes.
inline constexpr size_t kMaxLogMessageBytes = 2047;

// Writes one line to the error log when level <= the debug level: the formatted text, cut to
// kMaxLogMessageBytes, then one newline. Writes nothing while no error log is attached.
// Level-0 lines are rate-limited by their text: a text written less than the repeat interval
// ago is counted instead of written, and when that interval ends one line "TEXT repeated N
// times in the last I s" follows, written by the next line or, when none comes, by a thread
// the error log starts at the first counted repeat and stops in CloseLogs (which writes the
// counts still open). Different texts are never counted together; lines of the higher
// levels are always written.
// While a RuleMessageScope is open on the calling thread, lines of levels 0 and 1 (the
// problems; traces are written at 2 and above) end with ` (rule "NAME" in FILE)`.
void LogMessage(int64_t level, const char* format, ...) __attribute__((format(printf, 2, 3)));

// How many problem lines (levels 0 and 1, written or not) the calling thread has raised under
// a RuleMessageScope: an action that raised one has failed.
uint64_t RuleProblemCount();

// Names the rule the calling thread runs in its problem messages until destroyed; scopes nest.
// name and file must outlive the scope.
class RuleMessageScope {
 public:
  RuleMessageScope(const std::string& name, const std::string& file);
  ~RuleMessageScope();
  RuleMessageScope(const RuleMessageScope&) = delete;
  RuleMessageScope& operator=(const RuleMessageScope&) = delete;

 private:
  const std::string* mName;
  const std::string* mFile;
};

// The repeat interval in seconds (10 until set); 0 or less writes every line. The counts
// still open are written first.
void SetLogRepeatInterval(double seconds);

void SetDebugLevel(int64_t level);
int64_t DebugLevel();

// Writes one line to standard error (the console log of log set-up).
void ConsoleMessage(const char* format, ...) __attribute__((format(printf, 1, 2)));

// Every log destination is opened write-only and non-blocking, so that neither a FIFO (whose
// reader would be the daemon itself, or nobody) nor a device can hold a thread up, and is
// accepted only when it is a regular file or /dev/null.

// Opens path as a log destination with the extra flags (O_CREAT, O_APPEND, O_NOFOLLOW) and
// mode. Returns the descriptor, or -1 with errno set (EINVAL for anything but a regular file
// or /dev/null; ENXIO for a FIFO nobody reads).
int OpenLogDestination(const char* path, int flags, mode_t mode);

// Opens path as a log destination without following a link planted there: a missing path is
// created exclusively with mode; an existing one is opened with flags and accepted only when
// the opened file is the one lstat saw (same mode, inode and device). Returns the descriptor,
// or -1 with errno set (EACCES for a link or a swapped file, EINVAL as OpenLogDestination).
int SafeOpen(const char* path, mode_t mode, int flags);

// Take ownership of an open, appending descriptor as the error log / event log.
void AttachErrorLog(int fd);
void AttachEventLog(int fd);
// A close-on-exec duplicate (numbered 3 or above) of the error log's descriptor, for a child
// process that writes its own lines before it executes a program; -1 while no error log is
// attached. The caller closes it.
int DuplicateErrorLog();
// Appends the event's text form and one newline to the event log, when one is attached.
void LogEvent(const plist::Dictionary& event);
// Syncs and closes both logs; afterwards LogMessage and LogEvent write nothing.
void CloseLogs();

}  // namespace tarvod
