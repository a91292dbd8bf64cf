#include "platform/diagnostic_log.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/clock.h"
#include "platform/repeat_limiter.h"
#include "platform/worker_thread.h"

namespace tarvod {
namespace {

std::atomic<int64_t> gDebugLevel{0};

// Level-0 lines are written at every debug level, so a failure that recurs on every event
// floods the log with them; they go through the repeat limiter. The higher levels are traces
// the operator asks for, whose every line is needed to follow a rule, and are never limited.
constexpr int64_t kHighestLimitedLevel = 0;

// The error log. Every field is guarded by mLock: the descriptor (-1 while no error log is
// attached), the buffer messages are formatted into, the repeat limiter and the state of the
// summary writer.
struct ErrorLog {
  ~ErrorLog();

  std::mutex mLock;
  int mFd = -1;
  char mBuffer[kMaxLogMessageBytes + 1];
  const Clock& mClock = Clock::System();
  RepeatLimiter mRepeats{mClock, kDefaultLogRepeatInterval};
  std::vector<std::string> mSummaries;  // the limiter's summary lines, waiting to be written
  // Writes a window's summary when the window ends and no further line comes to do it.
  // Started at the first repeat that is counted; stopped by CloseLogs.
  std::thread mSummaryWriter;
  std::condition_variable mWindowsChanged;
  bool mWriterIdle = false;  // the writer waits for a window to open
  bool mStopWriter = false;
};

ErrorLog gErrorLog;

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

// Writes the summary lines the limiter handed out; drops them while no error log is attached.
// Called with mLock held.
void WriteSummaries(ErrorLog& log) {
  if (log.mFd >= 0) {
    for (const std::string& line : log.mSummaries) {
      WriteFully(log.mFd, line.data(), line.size());
      WriteFully(log.mFd, "\n", 1);
    }
  }
  log.mSummaries.clear();
}

void RunSummaryWriter(ErrorLog& log) {
  std::unique_lock<std::mutex> lock(log.mLock);
  while (!log.mStopWriter) {
    const std::optional<double> end = log.mRepeats.nextEnd();
    if (!end) {
      log.mWriterIdle = true;
      log.mWindowsChanged.wait(lock);
      log.mWriterIdle = false;
      continue;
    }
    const double wait = *end - log.mClock.monotonic();
    if (wait > 0) {
      log.mWindowsChanged.wait_for(lock, std::chrono::duration<double>(wait));
      continue;
    }
    log.mRepeats.collectEnded(log.mSummaries);
    WriteSummaries(log);
  }
}

// Stops the summary writer and waits for it. Called without mLock.
void StopSummaryWriter(ErrorLog& log) {
  std::thread writer;
  {
    std::lock_guard<std::mutex> lock(log.mLock);
    log.mStopWriter = true;
    writer = std::move(log.mSummaryWriter);
  }
  log.mWindowsChanged.notify_all();
  if (writer.joinable()) writer.join();
  std::lock_guard<std::mutex> lock(log.mLock);
  log.mStopWriter = false;
}

ErrorLog::~ErrorLog() { StopSummaryWriter(*this); }

constexpr int kLogOpenFlags = O_WRONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;

bool IsLogDestination(const struct stat& file) {
  if (S_ISREG(file.st_mode)) return true;
  struct stat null {};
  return S_ISCHR(file.st_mode) && stat("/dev/null", &null) == 0 && S_ISCHR(null.st_mode) &&
         file.st_rdev == null.st_rdev;
}

}  // namespace

void SetDebugLevel(int64_t level) { gDebugLevel.store(level, std::memory_order_relaxed); }
int64_t DebugLevel() { return gDebugLevel.load(std::memory_order_relaxed); }

namespace {

// The rule this thread is running, while a RuleMessageScope is open.
thread_local const std::string* tRuleName = nullptr;
thread_local const std::string* tRuleFile = nullptr;
thread_local uint64_t tRuleProblems = 0;

// Problems raised while a rule runs are written at these levels; traces use the higher ones.
constexpr int64_t kHighestRuleProblemLevel = 1;

}  // namespace

RuleMessageScope::RuleMessageScope(const std::string& name, const std::string& file)
    : mName(tRuleName), mFile(tRuleFile) {
  tRuleName = &name;
  tRuleFile = &file;
}

RuleMessageScope::~RuleMessageScope() {
  tRuleName = mName;
  tRuleFile = mFile;
}

uint64_t RuleProblemCount() { return tRuleProblems; }

void LogMessage(int64_t level, const char* format, ...) {
  if (tRuleName != nullptr && level <= kHighestRuleProblemLevel) ++tRuleProblems;
  if (level > gDebugLevel.load(std::memory_order_relaxed)) return;
  ErrorLog& log = gErrorLog;
  std::lock_guard<std::mutex> lock(log.mLock);
  if (log.mFd < 0) return;
  va_list args;
  va_start(args, format);
  const int n = std::vsnprintf(log.mBuffer, sizeof log.mBuffer, format, args);
  va_end(args);
  size_t length = 0;
  if (n > 0) length = std::min(static_cast<size_t>(n), kMaxLogMessageBytes);
  if (tRuleName != nullptr && level <= kHighestRuleProblemLevel) {
    // The message text stays first; the rule follows, cutting the text rather than itself.
    const std::string rule = " (rule \"" + *tRuleName + "\" in " + *tRuleFile + ")";
    const size_t kept = std::min(rule.size(), kMaxLogMessageBytes);
    length = std::min(length, kMaxLogMessageBytes - kept);
    std::memcpy(log.mBuffer + length, rule.data(), kept);
    length += kept;
  }
  bool write = true;
  if (level <= kHighestLimitedLevel) {
    write = log.mRepeats.admit(std::string_view(log.mBuffer, length), log.mSummaries);
    if (!write && !log.mSummaryWriter.joinable()) {
      log.mSummaryWriter = StartWorkerThread([&log] { RunSummaryWriter(log); });
    } else if (write && log.mWriterIdle) {
      log.mWindowsChanged.notify_one();  // a window opened: the writer waits for its end
    }
  } else {
    log.mRepeats.collectEnded(log.mSummaries);
  }
  WriteSummaries(log);
  if (!write) return;
  WriteFully(log.mFd, log.mBuffer, length);
  WriteFully(log.mFd, "\n", 1);
}

void SetLogRepeatInterval(double seconds) {
  ErrorLog& log = gErrorLog;
  std::lock_guard<std::mutex> lock(log.mLock);
  log.mRepeats.collectAll(log.mSummaries);
  WriteSummaries(log);
  log.mRepeats.setInterval(seconds);
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

int OpenLogDestination(const char* path, int flags, mode_t mode) {
  const int fd = open(path, flags | kLogOpenFlags, mode);
  if (fd < 0) return -1;
  struct stat opened {};
  if (fstat(fd, &opened) != 0 || !IsLogDestination(opened)) {
    close(fd);
    errno = EINVAL;
    return -1;
  }
  return fd;
}

int SafeOpen(const char* path, mode_t mode, int flags) {
  struct stat before {};
  if (lstat(path, &before) != 0) {
    if (errno != ENOENT) return -1;
    return open(path, flags | kLogOpenFlags | O_CREAT | O_EXCL, mode);
  }
  // Checked before the open too, since opening a device can have effects of its own; a link
  // is refused below, as a swapped file.
  if (!S_ISLNK(before.st_mode) && !IsLogDestination(before)) {
    errno = EINVAL;
    return -1;
  }
  const int fd = open(path, flags | kLogOpenFlags, mode);
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
  ErrorLog& log = gErrorLog;
  std::lock_guard<std::mutex> lock(log.mLock);
  if (log.mFd >= 0) close(log.mFd);
  log.mFd = fd;
}

void AttachEventLog(int fd) {
  lseek(fd, 0, SEEK_END);
  // Writers read the descriptor without a lock: a reopen moves the new file onto the number
  // already in use, in one step, so that a writer never meets a closed or reused number.
  const int current = gEventLogFd.load();
  if (current >= 0 && dup3(fd, current, O_CLOEXEC) >= 0) {
    close(fd);
    return;
  }
  const int old = gEventLogFd.exchange(fd);
  if (old >= 0) close(old);
}

int DuplicateErrorLog() {
  ErrorLog& log = gErrorLog;
  std::lock_guard<std::mutex> lock(log.mLock);
  return log.mFd < 0 ? -1 : fcntl(log.mFd, F_DUPFD_CLOEXEC, 3);
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
  ErrorLog& log = gErrorLog;
  {
    std::lock_guard<std::mutex> lock(log.mLock);
    // The counts of the windows still open are written before the log closes.
    log.mRepeats.collectAll(log.mSummaries);
    WriteSummaries(log);
    if (log.mFd >= 0) {
      fsync(log.mFd);
      close(log.mFd);
      log.mFd = -1;
    }
  }
  StopSummaryWriter(log);
}

}  // namespace tarvod
