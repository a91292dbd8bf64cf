#include "platform/diagnostic_log.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
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
  void SetUp() override {
    char pattern[] = "/tmp/tarvod-log-XXXXXX";
    dir_ = mkdtemp(pattern);
    path_ = dir_ + "/error.log";
    const int fd = SafeOpen(path_.c_str(), 0600, O_WRONLY | O_APPEND);
    ASSERT_GE(fd, 0);
    AttachErrorLog(fd);
  }
  void TearDown() override {
    CloseLogs();
    SetDebugLevel(0);
    SetLogRepeatInterval(kDefaultLogRepeatInterval);
    std::error_code ignored;
    std::filesystem::remove_all(dir_, ignored);
  }
  std::string dir_, path_;
};

TEST_F(DiagnosticLogTest, WritesOnlyLevelsUpToTheDebugLevel) {
  SetDebugLevel(3);
  for (int level = 0; level <= 6; ++level) LogMessage(level, "level %d", level);
  SetDebugLevel(-1);
  LogMessage(0, "never");
  EXPECT_EQ(testing::ReadWholeFile(path_), "level 0\nlevel 1\nlevel 2\nlevel 3\n");
}

TEST_F(DiagnosticLogTest, CutsLongMessagesAndAlwaysAddsOneNewline) {
  LogMessage(0, "%s", std::string(3000, 'x').c_str());
  LogMessage(0, "Loaded %d rules\n", 2);
  EXPECT_EQ(testing::ReadWholeFile(path_), std::string(2047, 'x') + "\nLoaded 2 rules\n\n");
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
  EXPECT_EQ(testing::ReadWholeFile(path_), "LOG: Cannot open /x" + rule + "\ntrace\n" +
                                               std::string(2047 - rule.size(), 'x') + rule +
                                               "\nafter\n");
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
  std::istringstream lines(testing::ReadWholeFile(path_));
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
  SetDebugLevel(1);
  for (int i = 0; i < 5; ++i) {
    LogMessage(0, "LOG: Cannot open %s errno = %d", "/a", 2);
    LogMessage(1, "trace");
    LogMessage(2, "above the debug level");
  }
  LogMessage(0, "LOG: Cannot open %s errno = %d", "/b", 2);
  CloseLogs();
  EXPECT_EQ(testing::ReadWholeFile(path_),
            "LOG: Cannot open /a errno = 2\ntrace\ntrace\ntrace\ntrace\ntrace\n"
            "LOG: Cannot open /b errno = 2\n"
            "LOG: Cannot open /a errno = 2 repeated 4 times in the last 10 s\n");
}

TEST_F(DiagnosticLogTest, AZeroRepeatIntervalWritesTheOpenCountsThenEveryLine) {
  for (int i = 0; i < 3; ++i) LogMessage(0, "again");
  SetLogRepeatInterval(0);
  for (int i = 0; i < 3; ++i) LogMessage(0, "again");
  CloseLogs();
  EXPECT_EQ(testing::ReadWholeFile(path_),
            "again\nagain repeated 2 times in the last 10 s\nagain\nagain\nagain\n");
}

TEST_F(DiagnosticLogTest, NothingIsWrittenAfterTheLogsAreClosed) {
  LogMessage(0, "before");
  CloseLogs();
  LogMessage(0, "after");
  EXPECT_EQ(testing::ReadWholeFile(path_), "before\n");
}

TEST_F(DiagnosticLogTest, SafeOpenRefusesLinksAndAcceptsHardLinks) {
  const std::string target = dir_ + "/target";
  const std::string soft = dir_ + "/soft";
  const std::string hard = dir_ + "/hard";
  const std::string fresh = dir_ + "/fresh";
  ASSERT_EQ(close(open(target.c_str(), O_CREAT | O_WRONLY, 0644)), 0);
  ASSERT_EQ(symlink(target.c_str(), soft.c_str()), 0);
  ASSERT_EQ(link(target.c_str(), hard.c_str()), 0);

  errno = 0;
  EXPECT_EQ(SafeOpen(soft.c_str(), 0600, O_WRONLY | O_APPEND), -1);
  EXPECT_EQ(errno, EACCES);
  const int fd = SafeOpen(hard.c_str(), 0600, O_WRONLY | O_APPEND);
  EXPECT_GE(fd, 0);
  close(fd);

  const mode_t old = umask(0);
  const int created = SafeOpen(fresh.c_str(), 0600, O_WRONLY | O_APPEND);
  umask(old);
  ASSERT_GE(created, 0);
  close(created);
  struct stat st {};
  ASSERT_EQ(stat(fresh.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
}

TEST_F(DiagnosticLogTest, LogDestinationsMustBeRegularFilesOrDevNull) {
  const std::string lonelyFifo = dir_ + "/lonely";
  const std::string readFifo = dir_ + "/read";
  const std::string regular = dir_ + "/regular";
  ASSERT_EQ(mkfifo(lonelyFifo.c_str(), 0600), 0);
  ASSERT_EQ(mkfifo(readFifo.c_str(), 0600), 0);
  // A reader that is not the daemon: opening the FIFO for writing would then succeed at once.
  const int reader = open(readFifo.c_str(), O_RDONLY | O_NONBLOCK);
  ASSERT_GE(reader, 0);
  const struct {
    std::string path;
    int error;  // 0: accepted
  } cases[] = {
      {regular, 0},       {"/dev/null", 0}, {lonelyFifo, ENXIO},
      {readFifo, EINVAL}, {dir_, EISDIR},   {"/dev/zero", EINVAL},
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
