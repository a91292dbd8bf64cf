#include "harness.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

#include "platform/seqpacket.h"
#include "rules_xml.h"

namespace tarvod::testing {

namespace fs = std::filesystem;

std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream buffer;
  buffer << in.rdbuf();
  return buffer.str();
}

bool FileExists(const std::string& path) {
  struct stat st {};
  return lstat(path.c_str(), &st) == 0;
}

TempDir::TempDir() {
  char pattern[] = "/tmp/tarvod-test-XXXXXX";
  const char* made = mkdtemp(pattern);
  mPath = made ? made : "/tmp/tarvod-test-failed";
  chmod(mPath.c_str(), 0755);  // senders under other identities must reach sockets inside
}

TempDir::~TempDir() {
  std::error_code ignored;
  fs::remove_all(mPath, ignored);
}

std::string TempDir::write(std::string_view name, std::string_view content) const {
  const std::string path = file(name);
  fs::create_directories(fs::path(path).parent_path());
  std::ofstream(path, std::ios::binary | std::ios::trunc) << content;
  return path;
}

std::string TarvodBinary() {
  if (const char* env = std::getenv("TARVOD_BINARY")) return env;
  return TARVOD_BINARY_PATH;
}

std::string TarvodctlBinary() {
  if (const char* env = std::getenv("TARVODCTL_BINARY")) return env;
  return TARVODCTL_BINARY_PATH;
}

std::string PlistDocument(std::string_view bodyXml) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
         "<!DOCTYPE plist PUBLIC \"-//Apple//DTD PLIST 1.0//EN\" "
         "\"http://www.apple.com/DTDs/PropertyList-1.0.dtd\">\n"
         "<plist version=\"1.0\">\n" +
         std::string(bodyXml) + "\n</plist>\n";
}

std::string ConfigPlist(const ConfigEntries& config, std::string_view initialGlobalsXml) {
  std::string body = "<dict>\n<key>config</key>\n<dict>\n";
  for (const auto& [key, xml] : config) body += "<key>" + key + "</key>" + xml + "\n";
  body += "</dict>\n";
  if (!initialGlobalsXml.empty()) {
    body += "<key>initialGlobals</key>\n" + std::string(initialGlobalsXml) + "\n";
  }
  return PlistDocument(body + "</dict>");
}

namespace {

std::vector<char*> Argv(const std::vector<std::string>& args) {
  std::vector<char*> argv;
  for (const auto& a : args) argv.push_back(const_cast<char*>(a.c_str()));
  argv.push_back(nullptr);
  return argv;
}

void DrainInto(int fd, std::string& out) {
  char buffer[4096];
  for (;;) {
    const ssize_t n = read(fd, buffer, sizeof buffer);
    if (n <= 0) return;
    out.append(buffer, static_cast<size_t>(n));
  }
}

}  // namespace

RunResult RunProgram(const std::vector<std::string>& argv, std::string_view stdinText,
                     std::chrono::milliseconds timeout) {
  RunResult result;
  int in[2], out[2], err[2];
  if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0) {
    return result;
  }
  const pid_t pid = fork();
  if (pid == 0) {
    dup2(in[0], 0);
    dup2(out[1], 1);
    dup2(err[1], 2);
    auto args = Argv(argv);
    execv(args[0], args.data());
    _exit(127);
  }
  close(in[0]);
  close(out[1]);
  close(err[1]);
  // The input is small in every test; write it all, then close.
  size_t written = 0;
  while (written < stdinText.size()) {
    const ssize_t n = write(in[1], stdinText.data() + written, stdinText.size() - written);
    if (n <= 0) break;
    written += static_cast<size_t>(n);
  }
  close(in[1]);
  fcntl(out[0], F_SETFL, O_NONBLOCK);
  fcntl(err[0], F_SETFL, O_NONBLOCK);
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    pollfd fds[2] = {{out[0], POLLIN, 0}, {err[0], POLLIN, 0}};
    poll(fds, 2, 20);
    DrainInto(out[0], result.out);
    DrainInto(err[0], result.err);
    int status = 0;
    if (waitpid(pid, &status, WNOHANG) == pid) {
      DrainInto(out[0], result.out);
      DrainInto(err[0], result.err);
      result.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
      break;
    }
    if (std::chrono::steady_clock::now() > deadline) {
      kill(pid, SIGKILL);
      waitpid(pid, &status, 0);
      result.status = -1;
      break;
    }
  }
  close(out[0]);
  close(err[0]);
  return result;
}

Daemon::Daemon(const std::vector<std::string>& args, const TempDir& dir,
               const std::vector<std::string>& launcher) {
  mStderrPath = dir.file("daemon.stderr");
  const std::string stdoutPath = dir.file("daemon.stdout");
  std::vector<std::string> full = launcher;
  full.push_back(TarvodBinary());
  full.insert(full.end(), args.begin(), args.end());
  mPid = fork();
  if (mPid == 0) {
    const int out = open(stdoutPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    const int err = open(mStderrPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (out >= 0) dup2(out, 1);
    if (err >= 0) dup2(err, 2);
    const int null = open("/dev/null", O_RDONLY);
    if (null >= 0) dup2(null, 0);
    auto argv = Argv(full);
    execv(argv[0], argv.data());
    _exit(127);
  }
}

Daemon::~Daemon() {
  if (mPid > 0 && mStatus < 0) {
    kill(mPid, SIGKILL);
    int status = 0;
    waitpid(mPid, &status, 0);
  }
}

bool Daemon::running() {
  if (mStatus >= 0) return false;
  int status = 0;
  if (waitpid(mPid, &status, WNOHANG) == mPid) {
    mStatus = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    return false;
  }
  return true;
}

bool Daemon::waitUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    if (done()) return true;
    if (!running()) return done();
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(10ms);
  }
}

bool Daemon::waitForLine(const std::string& file, std::string_view text,
                         std::chrono::milliseconds timeout) {
  return waitUntil([&] { return ReadFile(file).find(text) != std::string::npos; }, timeout);
}

bool Daemon::waitForStartup(const std::string& errorLog, std::chrono::milliseconds timeout) {
  return waitUntil(
      [&] {
        const std::string text = ReadFile(errorLog);
        const size_t first = text.find("Registered ");
        return first != std::string::npos &&
               text.find("Registered ", first + 1) != std::string::npos;
      },
      timeout);
}

int Daemon::stop(int signal, std::chrono::milliseconds timeout) {
  if (running()) kill(mPid, signal);
  return wait(timeout);
}

int Daemon::wait(std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (running() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(5ms);
  }
  return mStatus;
}

std::string Daemon::stderrText() const { return ReadFile(mStderrPath); }

namespace {
long StatusField(pid_t pid, std::string_view field) {
  std::istringstream in(ReadFile("/proc/" + std::to_string(pid) + "/status"));
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind(field, 0) == 0) return std::strtol(line.c_str() + field.size(), nullptr, 10);
  }
  return -1;
}
}  // namespace

int BindUnixDatagram(const std::string& path) {
  const int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
  if (bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0) return fd;
  close(fd);
  return -1;
}

size_t CountLines(const std::string& path) {
  const std::string text = ReadFile(path);
  return static_cast<size_t>(std::count(text.begin(), text.end(), '\n'));
}

bool WaitForLines(const std::string& path, size_t count, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (CountLines(path) < count) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(50ms);
  }
  return true;
}

std::string SendEvents(const std::string& socketPath, int count,
                       const std::function<std::string(int)>& eventXml) {
  SocketResult connection;
  for (int attempt = 0; attempt < 150; ++attempt) {
    connection = ConnectSeqpacket(socketPath);
    if (connection.fd >= 0) break;
    std::this_thread::sleep_for(100ms);
  }
  if (connection.fd < 0) return connection.error;
  std::string error;
  for (int i = 0; i < count && error.empty(); ++i) SendPacket(connection.fd, eventXml(i), &error);
  close(connection.fd);
  return error;
}

LineCount CountLogLine(const std::string& log, std::string_view line) {
  const std::string summary = std::string(line) + " repeated ";
  LineCount count;
  std::istringstream in(log);
  std::string text;
  while (std::getline(in, text)) {
    if (text == line) {
      ++count.written;
    } else if (text.rfind(summary, 0) == 0) {
      count.repeated += std::strtoull(text.c_str() + summary.size(), nullptr, 10);
    }
  }
  return count;
}

long PeakResidentKb(pid_t pid) { return StatusField(pid, "VmHWM:"); }

RunResult Tarvodctl(std::vector<std::string> args, std::string_view stdinText) {
  args.insert(args.begin(), TarvodctlBinary());
  return RunProgram(args, stdinText);
}

std::string TarvodTest::writeConfig(const ConfigEntries& extra, std::string_view globalsXml) const {
  ConfigEntries entries;
  for (const auto& [key, path] : {std::pair{"errorLogPath", errorLog},
                                  {"structuredLogPath", records},
                                  {"eventSocketPath", socket},
                                  {"stateDirectory", dir.path()}}) {
    const bool given = std::any_of(extra.begin(), extra.end(),
                                   [&](const auto& entry) { return entry.first == key; });
    if (!given) entries.emplace_back(key, Str(path));
  }
  for (const auto& entry : extra) {
    if (!entry.second.empty()) entries.push_back(entry);
  }
  return dir.write("tarvod.plist", ConfigPlist(entries, globalsXml));
}

Daemon& TarvodTest::start(const std::vector<std::string>& rules, int level,
                          const ConfigEntries& config, const std::vector<std::string>& launcher) {
  const std::string configPath = writeConfig(config);
  dir.write("rules.plist", RulesDocument(rules));
  started = std::make_unique<Daemon>(std::vector<std::string>{"-c", configPath, "-r", rulesPath,
                                                              "-v", std::to_string(level), "-n"},
                                     dir, launcher);
  if (level > 0) {
    EXPECT_TRUE(started->waitForStartup(errorLog)) << started->stderrText() << ReadFile(errorLog);
  }
  return *started;
}

std::string TarvodTest::run(const std::vector<std::string>& rules, int level,
                            const ConfigEntries& config,
                            const std::function<void(Daemon&)>& whileRunning,
                            const std::vector<std::string>& launcher) {
  start(rules, level, config, launcher);
  if (whileRunning) whileRunning(*started);
  EXPECT_EQ(started->stop(), 0);
  return ReadFile(errorLog);
}

std::string TarvodTest::runActions(std::vector<std::string> actions, int level,
                                   const ConfigEntries& config,
                                   const std::vector<std::string>& launcher) {
  const std::string marker = dir.file("done");
  actions.push_back(FileLog("done", marker));
  return run(
      {RuleXml("actions", {"startup.load"}, {{"actions", Arr(actions)}})}, level, config,
      [&](Daemon& running) {
        EXPECT_TRUE(running.waitForLine(marker, "done", 60s)) << ReadFile(errorLog);
      },
      launcher);
}

}  // namespace tarvod::testing
