#include "daemon/logs.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string>

#include "daemon/configuration.h"
#include "platform/diagnostic_log.h"
#include "platform/repeat_limiter.h"

namespace tarvod {
namespace {

// Makes sure the fixed log directory exists as a real directory (a link to one is refused).
bool EnsureVelkinDirectory() {
  struct stat st {};
  if (lstat(kVelkinLogDirectory, &st) != 0) {
    if (errno != ENOENT) {
      ConsoleMessage("failed to find %s errno = %d", kVelkinLogDirectory, errno);
      return false;
    }
    if (mkdir(kVelkinLogDirectory, 0775) != 0) {
      ConsoleMessage("failed to create %s errno = %d", kVelkinLogDirectory, errno);
      return false;
    }
    return true;
  }
  if (!S_ISDIR(st.st_mode)) {
    ConsoleMessage("%s is not a directory", kVelkinLogDirectory);
    return false;
  }
  return true;
}

int OpenLog(const std::string& path) {
  ConsoleMessage("SetUpLogs: opening %s", path.c_str());
  const int fd = SafeOpen(path.c_str(), 0600, O_WRONLY | O_APPEND);
  if (fd < 0) ConsoleMessage("failed to open %s errno = %d", path.c_str(), errno);
  return fd;
}

}  // namespace

int SetUpLogs(const plist::Dictionary& configuration) {
  ConsoleMessage("SetUpLogs: uid = %ld gid = %ld", static_cast<long>(getuid()),
                 static_cast<long>(getgid()));
  SetLogRepeatInterval(
      configuration.contains("logRepeatInterval")
          ? static_cast<double>(ConfigurationInteger(configuration, "logRepeatInterval"))
          : kDefaultLogRepeatInterval);
  if (const std::string* errorLogPath = configuration.findString("errorLogPath")) {
    if (errorLogPath->rfind(kVelkinLogDirectory, 0) == 0 && !EnsureVelkinDirectory()) return -1;
    const int fd = OpenLog(*errorLogPath);
    if (fd < 0) return -1;
    AttachErrorLog(fd);
  }
  if (ConfigurationInteger(configuration, "logEvents") == 0) return 0;
  const std::string* eventLogPath = configuration.findString("eventLogPath");
  if (!eventLogPath) return 0;
  const int fd = OpenLog(*eventLogPath);
  if (fd < 0) return -1;
  AttachEventLog(fd);
  return 0;
}

void ReopenLogs(const plist::Dictionary& configuration) {
  const auto reopen = [](const std::string* path, void (*attach)(int)) {
    if (path == nullptr) return;
    const int fd = SafeOpen(path->c_str(), 0600, O_WRONLY | O_APPEND);
    if (fd < 0) {
      LogMessage(0, "Cannot reopen %s (errno = %d); still writing to the file open before",
                 path->c_str(), errno);
      return;
    }
    attach(fd);
  };
  reopen(configuration.findString("errorLogPath"), AttachErrorLog);
  if (ConfigurationInteger(configuration, "logEvents") != 0) {
    reopen(configuration.findString("eventLogPath"), AttachEventLog);
  }
}

}  // namespace tarvod
