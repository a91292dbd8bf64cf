#include "platform/diagnostic_log.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/repeat_limiter.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

class DiagnosticLogTest : public ::testing::Test {
 protected:
  testing::LogCapture capture_{0};
};

TEST_F(DiagnosticLogTest, WritesLevelsUpToTheDebugLevelCutAndEndedByOneNewlineUntilClosed) {
  SetDebugLevel(3);
  for (int level = 0; level <= 6; ++level) LogMessage(level, "level %d", level);
  SetDebugLevel(-1);
  LogMessage(0, "never");
  SetDebugLevel(0);
  LogMessage(0, "%s", std::string(3000, 'x').c_str());
  LogMessage(0, "Loaded %d rules\n", 2);
  CloseLogs();
  LogMessage(0, "after");
  EXPECT_EQ(capture_.text(), "level 0\nlevel 1\nlevel 2\nlevel 3\n" + std::string(2047, 'x') +
                                 "\nLoaded 2 rules\n\n");
}

TEST_F(DiagnosticLogTest, ProblemsWrittenWhileARuleRunsNameItAfterTheirText) {
  SetDebugLevel(2);
  const std::string name = "ban", file = "/r/ssh.plist";
  {
    const RuleMessageScope scope(name, file);
    LogMessage(0, "LOG: Cannot open %s", "/x");
    LogMessage(2, "trace");
    LogMessage(1, "%s", std::string(3000, 'x').c_str());
  }
  LogMessage(0, "after");
  const std::string rule = " (rule \"ban\" in /r/ssh.plist)";
  EXPECT_EQ(capture_.text(), "LOG: Cannot open /x" + rule + "\ntrace\n" +
                                 std::string(2047 - rule.size(), 'x') + rule + "\nafter\n");
}

TEST_F(DiagnosticLogTest, LinesFromConcurrentWritersNeverInterleave) {
  std::vector<std::thread> writers;
  for (int t = 0; t < 4; ++t) {
    writers.emplace_back([t] {
      for (int i = 0; i < 200; ++i) {
        LogMessage(0, "%d:%03d:%s", t, i, std::string(100, 'a' + t).c_str());
      }
    });
  }
  for (auto& w : writers) w.join();
  std::istringstream lines(capture_.text());
  std::string line;
  int count = 0;
  while (std::getline(lines, line)) {
    ++count;
    ASSERT_EQ(line.size(), 106u);
    EXPECT_EQ(line.substr(6), std::string(100, static_cast<char>('a' + (line[0] - '0'))));
  }
  EXPECT_EQ(count, 800);
}

TEST_F(DiagnosticLogTest, CountsRepeatedLevelZeroLinesAndWritesTheCountsAtClose) {
  SetLogRepeatInterval(kDefaultLogRepeatInterval);
  SetDebugLevel(1);
  for (int i = 0; i < 5; ++i) {
    LogMessage(0, "LOG: Cannot open %s errno = %d", "/a", 2);
    LogMessage(1, "trace");
    LogMessage(2, "above the debug level");
  }
  LogMessage(0, "LOG: Cannot open %s errno = %d", "/b", 2);
  CloseLogs();
  EXPECT_EQ(capture_.text(),
            "LOG: Cannot open /a errno = 2\ntrace\ntrace\ntrace\ntrace\ntrace\n"
            "LOG: Cannot open /b errno = 2\n"
            "LOG: Cannot open /a errno = 2 repeated 4 times in the last 10 s\n");
}

TEST_F(DiagnosticLogTest, AZeroRepeatIntervalWritesTheOpenCountsThenEveryLine) {
  SetLogRepeatInterval(kDefaultLogRepeatInterval);
  for (int i = 0; i < 3; ++i) LogMessage(0, "again");
  SetLogRepeatInterval(0);
  for (int i = 0; i < 3; ++i) LogMessage(0, "again");
  CloseLogs();
  EXPECT_EQ(capture_.text(),
            "again\nagain repeated 2 times in the last 10 s\nagain\nagain\nagain\n");
}

// Links and the created file's mode are checked through the daemon's own error log in tests/.
TEST_F(DiagnosticLogTest, LogDestinationsMustBeRegularFilesOrDevNull) {
  const std::string dir = capture_.directory();
  const std::string lonelyFifo = dir + "/lonely", readFifo = dir + "/read";
  ASSERT_EQ(mkfifo(lonelyFifo.c_str(), 0600), 0);
  ASSERT_EQ(mkfifo(readFifo.c_str(), 0600), 0);
  // A reader that is not the daemon: opening the FIFO for writing would then succeed at once.
  const int reader = open(readFifo.c_str(), O_RDONLY | O_NONBLOCK);
  ASSERT_GE(reader, 0);
  const struct {
    std::string path;
    int error;  // 0: accepted
  } cases[] = {
      {dir + "/regular", 0}, {"/dev/null", 0}, {lonelyFifo, ENXIO},
      {readFifo, EINVAL},    {dir, EISDIR},    {"/dev/zero", EINVAL},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path);
    for (const bool safe : {false, true}) {
      errno = 0;
      const int fd = safe ? SafeOpen(c.path.c_str(), 0600, O_APPEND)
                          : OpenLogDestination(c.path.c_str(), O_CREAT | O_APPEND, 0600);
      EXPECT_EQ(fd >= 0, c.error == 0);
      if (fd < 0) {
        // SafeOpen refuses what is no regular file before opening it.
        EXPECT_EQ(errno, safe ? EINVAL : c.error);
      } else {
        // Write-only: nothing the daemon writes can come back to it.
        EXPECT_EQ(fcntl(fd, F_GETFL) & O_ACCMODE, O_WRONLY);
        close(fd);
      }
    }
  }
  close(reader);
}

}  // namespace
}  // namespace tarvod
