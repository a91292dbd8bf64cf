#include "platform/diagnostic_log.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <mutex>
#include <string>

namespace tarvod {
namespace {

std::atomic<int64_t> gDebugLevel{0};

// The error log descriptor and the buffer messages are formatted into are both guarded by
// gErrorLogLock; the descriptor is -1 while no error log is attached.
std::mutex gErrorLogLock;
int gErrorLogFd = -1;
char gFormatBuffer[kMaxLogMessageBytes + 1];

std::atomic<int> gEventLogFd{-1};

// Writes all of the bytes, retrying short writes and interruptions. A failing log file
// (disk full, device error) must never stop the daemon, so errors are dropped here.
void WriteFully(int fd, const char* data, size_t length) {
  while (length > 0) {
    const ssize_t n = write(fd, data, length);
    if (n < 0) {
      if (errno == EINTR) continue;
      return;
    }
    data += n;
    length -= static_cast<size_t>(n);
  }
}

}  // namespace

void SetDebugLevel(int64_t level) { gDebugLevel.store(level, std::memory_order_relaxed); }
int64_t DebugLevel() { return gDebugLevel.load(std::memory_order_relaxed); }

void LogMessage(int64_t level, const char* format, ...) {
  if (level > gDebugLevel.load(std::memory_order_relaxed)) return;
  std::lock_guard<std::mutex> lock(gErrorLogLock);
  if (gErrorLogFd < 0) return;
  va_list args;
  va_start(args, format);
  const int n = std::vsnprintf(gFormatBuffer, sizeof gFormatBuffer, format, args);
  va_end(args);
  size_t length = 0;
  if (n > 0) length = std::min(static_cast<size_t>(n), kMaxLogMessageBytes);
  WriteFully(gErrorLogFd, gFormatBuffer, length);
  WriteFully(gErrorLogFd, "\n", 1);
}

void ConsoleMessage(const char* format, ...) {
  char buffer[kMaxLogMessageBytes + 1];
  va_list args;
  va_start(args, format);
  const int n = std::vsnprintf(buffer, sizeof buffer, format, args);
  va_end(args);
  std::string line(buffer, n > 0 ? std::min(static_cast<size_t>(n), kMaxLogMessageBytes) : 0);
  line += '\n';
  WriteFully(STDERR_FILENO, line.data(), line.size());
}

int SafeOpen(const char* path, mode_t mode, int flags) {
  struct stat before {};
  if (lstat(path, &before) != 0) {
    if (errno != ENOENT) return -1;
    return open(path, flags | O_CREAT | O_EXCL | O_CLOEXEC, mode);
  }
  const int fd = open(path, flags | O_CLOEXEC, mode);
  if (fd < 0) return -1;
  struct stat after {};
  if (fstat(fd, &after) != 0 || after.st_mode != before.st_mode || after.st_ino != before.st_ino ||
      after.st_dev != before.st_dev) {
    close(fd);
    errno = EACCES;
    return -1;
  }
  return fd;
}

void AttachErrorLog(int fd) {
  lseek(fd, 0, SEEK_END);
  std::lock_guard<std::mutex> lock(gErrorLogLock);
  if (gErrorLogFd >= 0) close(gErrorLogFd);
  gErrorLogFd = fd;
}

void AttachEventLog(int fd) {
  lseek(fd, 0, SEEK_END);
  const int old = gEventLogFd.exchange(fd);
  if (old >= 0) close(old);
}

int DuplicateErrorLog() {
  std::lock_guard<std::mutex> lock(gErrorLogLock);
  return gErrorLogFd < 0 ? -1 : fcntl(gErrorLogFd, F_DUPFD_CLOEXEC, 3);
}

void LogEvent(const plist::Dictionary& event) {
  const int fd = gEventLogFd.load();
  if (fd < 0) return;
  std::string text = plist::Describe(event);
  text += '\n';
  // One write keeps the records of concurrent dispatches from interleaving.
  WriteFully(fd, text.data(), text.size());
}

void CloseLogs() {
  const int eventFd = gEventLogFd.exchange(-1);
  if (eventFd >= 0) {
    fsync(eventFd);
    close(eventFd);
  }
  std::lock_guard<std::mutex> lock(gErrorLogLock);
  if (gErrorLogFd >= 0) {
    fsync(gErrorLogFd);
    close(gErrorLogFd);
    gErrorLogFd = -1;
  }
}

}  // namespace tarvod
