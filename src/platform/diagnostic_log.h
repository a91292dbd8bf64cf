// The diagnostic log: the error log every part of the daemon writes through LogMessage, the
// event log written by LogEvent, and the console (standard error) used while the logs are
// being set up. LogMessage, LogEvent and ConsoleMessage may be called from any thread.
#pragma once

#include <sys/types.h>

#include <cstdint>

#include "plist/value.h"

namespace tarvod {

// Longest text of one message; longer messages are cut to this many bytes.
inline constexpr size_t kMaxLogMessageBytes = 2047;

// Writes one line to the error log when level <= the debug level: the formatted text, cut to
// kMaxLogMessageBytes, then one newline. Writes nothing while no error log is attached.
void LogMessage(int64_t level, const char* format, ...) __attribute__((format(printf, 2, 3)));

void SetDebugLevel(int64_t level);
int64_t DebugLevel();

// Writes one line to standard error (the console log of log set-up).
void ConsoleMessage(const char* format, ...) __attribute__((format(printf, 1, 2)));

// Opens path without following a link planted there: a missing path is created exclusively
// with mode; an existing one is opened with flags and accepted only when the opened file is
// the one lstat saw (same mode, inode and device). Returns the descriptor, or -1 with errno
// set (EACCES for a link or a swapped file).
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
