// Helpers for integration tests that run the real tarvod binary: temporary directories,
// files, child processes and waiting for log lines. Test-thread only.
#pragma once

#include <gtest/gtest.h>
#include <sys/types.h>

#include <chrono>
#include <csignal>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace tarvod::testing {

using namespace std::chrono_literals;

std::string ReadFile(const std::string& path);
bool FileExists(const std::string& path);

// A fresh directory under /tmp, removed with everything in it at the end of the test.
class TempDir {
 public:
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::string& path() const { return mPath; }
  std::string file(std::string_view name) const { return mPath + "/" + std::string(name); }
  // Writes a file (creating parent directories) and returns its full path.
  std::string write(std::string_view name, std::string_view content) const;

 private:
  std::string mPath;
};

std::string TarvodBinary();
std::string TarvodctlBinary();

using ConfigEntries = std::vector<std::pair<std::string, std::string>>;

// An XML property list with a "config" dictionary built from XML fragments, for example
// ConfigPlist({{"errorLogPath", "<string>/tmp/x</string>"}}).
std::string ConfigPlist(const ConfigEntries& config, std::string_view initialGlobalsXml = {});
// Wraps dictionary/array XML in a plist document.
std::string PlistDocument(std::string_view bodyXml);

struct RunResult {
  int status = -1;  // exit status, or 128 + signal
  std::string out;
  std::string err;
};
// Runs a program to completion (killed after timeout) and collects its output.
RunResult RunProgram(const std::vector<std::string>& argv, std::string_view stdinText = {},
                     std::chrono::milliseconds timeout = 30s);
RunResult Tarvodctl(std::vector<std::string> args, std::string_view stdinText = {});

// A running tarvod. The destructor kills it if it is still running.
class Daemon {
 public:
  // Starts the binary with args (argv[0] is added); stdout and stderr go to files in dir.
  // A launcher (for example {"unshare", "--user", "--map-root-user"}) runs the binary in
  // its place, with the same process ID.
  Daemon(const std::vector<std::string>& args, const TempDir& dir,
         const std::vector<std::string>& launcher = {});
  ~Daemon();
  Daemon(const Daemon&) = delete;
  Daemon& operator=(const Daemon&) = delete;

  pid_t pid() const { return mPid; }
  // Waits until the file contains text; false on timeout or when the daemon exited first
  // without writing it.
  bool waitForLine(const std::string& file, std::string_view text,
                   std::chrono::milliseconds timeout = 15s);
  // Waits until startup is over and the sources listen: startup logs "Registered %d events"
  // once while it registers the notifications and once more after the sources started.
  bool waitForStartup(const std::string& errorLog, std::chrono::milliseconds timeout = 15s);
  // Sends the signal and waits for the exit status (128 + signal when killed by one).
  int stop(int signal = SIGTERM, std::chrono::milliseconds timeout = 20s);
  // Waits for the daemon to exit by itself.
  int wait(std::chrono::milliseconds timeout = 20s);
  bool running();
  std::string stderrText() const;

 private:
  bool waitUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout);

  pid_t mPid = -1;
  int mStatus = -1;
  std::string mStderrPath;
};

// A datagram socket bound at path; -1 when it cannot be made.
int BindUnixDatagram(const std::string& path);

// Number of newline-terminated lines in a file; 0 when it cannot be read.
size_t CountLines(const std::string& path);
// Waits until the file holds at least count lines; false on timeout.
bool WaitForLines(const std::string& path, size_t count, std::chrono::milliseconds timeout);

// Sends count events over the event socket at socketPath on one connection, retrying the
// connection while the daemon's listener comes up; eventXml(i) is the i-th event's property
// list. Returns the empty string, or what failed.
std::string SendEvents(const std::string& socketPath, int count,
                       const std::function<std::string(int)>& eventXml);

// How often the error log reports one line: the times it was written and the sum N of its
// "LINE repeated N times in the last ..." summaries.
struct LineCount {
  size_t written = 0;
  uint64_t repeated = 0;
};
LineCount CountLogLine(const std::string& log, std::string_view line);

// Peak resident set size of a process in kB (VmHWM); -1 when unknown.
long PeakResidentKb(pid_t pid);

// A daemon whose files all live in the test's directory: error.log, records.jsonl, the event
// socket evtq and the state.
class TarvodTest : public ::testing::Test {
 protected:
  // Writes tarvod.plist: the files above, then extra; an extra entry with empty XML leaves
  // that default out, one with XML replaces it.
  std::string writeConfig(const ConfigEntries& extra = {}, std::string_view globalsXml = {}) const;
  // Starts the daemon (-n) on the rules at the debug level; from level 1 up, waits until its
  // sources listen.
  Daemon& start(const std::vector<std::string>& rules, int level, const ConfigEntries& config = {},
                const std::vector<std::string>& launcher = {});
  // start, then whileRunning, then a stop that must end with status 0; returns the error log.
  std::string run(const std::vector<std::string>& rules, int level,
                  const ConfigEntries& config = {},
                  const std::function<void(Daemon&)>& whileRunning = {},
                  const std::vector<std::string>& launcher = {});
  // Runs the actions in a startup rule named "actions" until they have all run.
  std::string runActions(std::vector<std::string> actions, int level,
                         const ConfigEntries& config = {},
                         const std::vector<std::string>& launcher = {});

  TempDir dir;
  const std::string errorLog = dir.file("error.log");
  const std::string records = dir.file("records.jsonl");
  const std::string socket = dir.file("evtq");
  const std::string rulesPath = dir.file("rules.plist");
  const std::string out = dir.file("out.log");
  std::unique_ptr<Daemon> started;  // by start()
};

}  // namespace tarvod::testing
