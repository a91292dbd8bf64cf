// Unit-test helper: points the error log at a fresh temporary file for the life of the object,
// so a test can read back exactly what was logged: every line, with the repeat limit off (it
// has tests of its own). Test thread only.
#pragma once

#include <fcntl.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <initializer_list>
#include <sstream>
#include <string>
#include <string_view>

#include "platform/diagnostic_log.h"
#include "platform/repeat_limiter.h"

namespace tarvod::testing {

// The whole content of a file; empty when it cannot be read.
inline std::string ReadWholeFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream s;
  s << in.rdbuf();
  return s.str();
}

class LogCapture {
 public:
  explicit LogCapture(int64_t level = 6) {
    char pattern[] = "/tmp/tarvod-log-XXXXXX";
    if (mkdtemp(pattern)) mDirectory = pattern;
    mPath = mDirectory + "/error.log";
    const int fd = SafeOpen(mPath.c_str(), 0600, O_WRONLY | O_APPEND);
    if (fd >= 0) AttachErrorLog(fd);
    SetDebugLevel(level);
    SetLogRepeatInterval(0);
  }
  ~LogCapture() {
    CloseLogs();
    SetDebugLevel(0);
    SetLogRepeatInterval(kDefaultLogRepeatInterval);
    std::error_code ignored;
    std::filesystem::remove_all(mDirectory, ignored);
  }
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  const std::string& path() const { return mPath; }
  const std::string& directory() const { return mDirectory; }
  std::string text() const { return ReadWholeFile(mPath); }

 private:
  std::string mDirectory = "/tmp";
  std::string mPath;
};

// True when each line appears in text after the one before it. Lines logged by one thread
// keep their order, but another thread may write between them.
inline bool LinesInOrder(const std::string& text, std::initializer_list<std::string_view> lines) {
  size_t from = 0;
  for (std::string_view line : lines) {
    const size_t found = text.find(line, from);
    if (found == std::string::npos) return false;
    from = found + line.size();
  }
  return true;
}

}  // namespace tarvod::testing
