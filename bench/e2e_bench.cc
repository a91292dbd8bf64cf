// The event path end to end, through the real binary, beside the floors it is measured
// against, all in one run (`make bench-e2e`):
//
//   - floor-open:   a socket reader that opens, appends one line to and closes a file per
//                   message;
//   - floor-kept:   the same reader with the file kept open;
//   - sec:          SEC (`sec --notail`) on the same events as text lines, with an equivalent
//                   rule writing the same line;
//   - tarvod:       the daemon with its default configuration;
//   - tarvod-kept:  the daemon with keepLogFilesOpen.
//
// The workload: N binary property lists of type auth.failure, prepared beforehand, sent over 4
// connections as fast as they are taken; one rule subscribed to "auth" with two criteria (equal
// and notequal on event values) and a file log action with a substituted line; JSON-lines
// records on (two per event: the full type, which has no rules, and the matched prefix); the
// error log at level 0. Throughput is the time from the first send until the last line and the
// last record are in their files. Latency is measured afterwards on the same daemon, at a fixed
// rate (10,000 events/s by default), from each send to its line's appearance (inotify). Peak
// RSS is the daemon's VmHWM after both; CPU per event and thread comes from
// /proc/PID/task/*/schedstat around the throughput run.
//
// Options: --events N (100000), --rate R (10000), --latency-events N (20000), --repeat K (3),
// --only NAME[,NAME] (run only these), --binary PATH, --baseline PATH (another build of the
// daemon, run as "baseline" with the default configuration, for before/after in one run).
// TARVOD_BENCH_WRAP="strace -c -f -o FILE" puts a command in front of the daemon (for profiles; the
// figures then include the tracer).
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/inotify.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/seqpacket.h"
#include "plist/codec.h"
#include "process_status.h"

using tarvod::bench::ProcStatusKb;
using tarvod::bench::XmlString;

namespace {

using Clock = std::chrono::steady_clock;
constexpr int kConnections = 4;

double Seconds(Clock::duration d) { return std::chrono::duration<double>(d).count(); }

// ---- events ----

struct Event {
  std::string user;
  std::string clientIP;
  std::string message;  // carries the sequence number the latency tailer reads back
};

Event MakeEvent(uint64_t sequence) {
  static const char* const kUsers[] = {"admin", "oracle", "test", "root", "ubuntu", "guest"};
  Event e;
  e.user = kUsers[sequence % 6];
  e.clientIP = "192.0.2." + std::to_string(sequence % 250 + 1);
  e.message = "Failed password for " + e.user + " from " + e.clientIP + " port " +
              std::to_string(sequence) + " ssh2";
  return e;
}

// Events first..first+count-1 for which the rule fires: every user but root (sequence 3 mod 6).
size_t FiringEvents(size_t first, size_t count) {
  size_t firing = 0;
  for (size_t i = first; i < first + count; ++i) firing += (i % 6 != 3);
  return firing;
}

// A minimal binary property-list writer: ASCII strings, one real, dictionaries.
class BinaryPlist {
 public:
  size_t string(const std::string& s) {
    std::string o;
    Marker(o, 0x5, s.size());
    o += s;
    return add(std::move(o));
  }
  size_t real(double d) {
    std::string o(1, static_cast<char>(0x23));
    uint64_t bits;
    std::memcpy(&bits, &d, 8);
    for (int i = 7; i >= 0; --i) o += static_cast<char>(bits >> (8 * i));
    return add(std::move(o));
  }
  // Keys and values are object indices; needs fewer than 256 objects.
  size_t dictionary(const std::vector<std::pair<size_t, size_t>>& entries) {
    std::string o;
    Marker(o, 0xD, entries.size());
    for (const auto& entry : entries) o += static_cast<char>(entry.first);
    for (const auto& entry : entries) o += static_cast<char>(entry.second);
    return add(std::move(o));
  }
  std::string finish(size_t top) {
    std::string out = "bplist00";
    std::vector<uint64_t> offsets;
    for (const std::string& o : mObjects) {
      offsets.push_back(out.size());
      out += o;
    }
    const uint64_t table = out.size();
    for (uint64_t offset : offsets) {
      out += static_cast<char>(offset >> 8);
      out += static_cast<char>(offset);
    }
    out += std::string(6, '\0');
    out += static_cast<char>(2);  // offset size
    out += static_cast<char>(1);  // reference size
    const auto be64 = [&](uint64_t v) {
      for (int i = 7; i >= 0; --i) out += static_cast<char>(v >> (8 * i));
    };
    be64(mObjects.size());
    be64(top);
    be64(table);
    return out;
  }

 private:
  static void Marker(std::string& o, int type, size_t count) {
    if (count < 15) {
      o += static_cast<char>(type << 4 | static_cast<int>(count));
      return;
    }
    o += static_cast<char>(type << 4 | 0xF);
    o += static_cast<char>(0x11);  // a two-byte integer follows
    o += static_cast<char>(count >> 8);
    o += static_cast<char>(count);
  }
  size_t add(std::string o) {
    mObjects.push_back(std::move(o));
    return mObjects.size() - 1;
  }
  std::vector<std::string> mObjects;
};

std::string EventPacket(const Event& e, double timestamp) {
  BinaryPlist p;
  const size_t details = p.dictionary({{p.string("clientIP"), p.string(e.clientIP)},
                                       {p.string("message"), p.string(e.message)},
                                       {p.string("protocolName"), p.string("SSH")},
                                       {p.string("username"), p.string(e.user)}});
  const size_t top = p.dictionary({{p.string("eventType"), p.string("auth.failure")},
                                   {p.string("eventSource"), p.string("Auditpipe")},
                                   {p.string("eventTimestamp"), p.real(timestamp)},
                                   {p.string("eventDetails"), details}});
  return p.finish(top);
}

// The same event as SEC reads it.
std::string EventText(const Event& e) {
  return "auth.failure source=Auditpipe protocolName=SSH username=" + e.user +
         " clientIP=" + e.clientIP + " message=" + e.message + "\n";
}

// The line both the rule and SEC write, and that the floors write in its place.
std::string LogLine(const Event& e) {
  return "failed login for " + e.user + " from " + e.clientIP + ": " + e.message + "\n";
}

// The sequence number in a line ("... port N ssh2"), or -1.
long SequenceOf(std::string_view line) {
  const size_t port = line.rfind(" port ");
  if (port == std::string_view::npos) return -1;
  return std::strtol(std::string(line.substr(port + 6)).c_str(), nullptr, 10);
}

// ---- files ----

void WriteFile(const std::string& path, const std::string& text) {
  std::ofstream(path, std::ios::binary) << text;
}

// Counts newlines appended to a file since the last call.
class LineCounter {
 public:
  explicit LineCounter(std::string path) : mPath(std::move(path)) {}
  size_t poll() {
    const int fd = open(mPath.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return mLines;
    char buffer[1 << 16];
    ssize_t n;
    while ((n = pread(fd, buffer, sizeof buffer, static_cast<off_t>(mOffset))) > 0) {
      mLines += static_cast<size_t>(std::count(buffer, buffer + n, '\n'));
      mOffset += static_cast<uint64_t>(n);
    }
    close(fd);
    return mLines;
  }

 private:
  std::string mPath;
  uint64_t mOffset = 0;
  size_t mLines = 0;
};

// ---- senders ----

// Sends packets[c], packets[c + K], ... on connection c, for every connection at once. With a
// rate, each packet leaves at its scheduled time (start + index / rate) and its send time is
// noted under its index.
void SendAll(const std::string& socketPath, const std::vector<std::string>& packets, double rate,
             std::vector<Clock::time_point>* sentAt) {
  std::vector<std::thread> senders;
  const Clock::time_point start = Clock::now();
  for (int c = 0; c < kConnections; ++c) {
    senders.emplace_back([&, c] {
      const tarvod::SocketResult connection = tarvod::ConnectSeqpacket(socketPath);
      if (connection.fd < 0) {
        std::fprintf(stderr, "connect: %s\n", connection.error.c_str());
        return;
      }
      for (size_t i = static_cast<size_t>(c); i < packets.size(); i += kConnections) {
        if (rate > 0) {
          std::this_thread::sleep_until(
              start + std::chrono::duration_cast<Clock::duration>(
                          std::chrono::duration<double>(static_cast<double>(i) / rate)));
        }
        if (sentAt) (*sentAt)[i] = Clock::now();
        const std::string& p = packets[i];
        while (send(connection.fd, p.data(), p.size(), MSG_NOSIGNAL) < 0) {
          if (errno == EINTR) continue;
          std::perror("send");
          close(connection.fd);
          return;
        }
      }
      close(connection.fd);
    });
  }
  for (auto& t : senders) t.join();
}

// ---- the floors ----

// A reader of the event socket that writes one line per message: opening and closing the file
// every time, or keeping it open. Returns the events per second.
double RunFloor(const std::string& directory, const std::vector<std::string>& packets,
                const std::vector<std::string>& lines, bool keepOpen) {
  const std::string socketPath = directory + "/floor.sock";
  const std::string output = directory + "/floor.log";
  std::filesystem::remove(output);
  tarvod::SocketResult listener = tarvod::ListenSeqpacket(socketPath, 128);
  if (listener.fd < 0) {
    std::fprintf(stderr, "floor: %s\n", listener.error.c_str());
    return 0;
  }
  const size_t total = packets.size();
  std::thread server([&] {
    const int epoll = epoll_create1(EPOLL_CLOEXEC);
    epoll_event event{EPOLLIN, {.fd = listener.fd}};
    epoll_ctl(epoll, EPOLL_CTL_ADD, listener.fd, &event);
    std::vector<uint8_t> buffer(1024 * 1024);
    std::vector<int> peers;
    int kept =
        keepOpen ? open(output.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644) : -1;
    size_t received = 0;
    while (received < total) {
      epoll_event ready[16];
      const int n = epoll_wait(epoll, ready, 16, 1000);
      for (int i = 0; i < n; ++i) {
        const int fd = ready[i].data.fd;
        if (fd == listener.fd) {
          const int peer = tarvod::AcceptSeqpacket(listener.fd);
          if (peer < 0) continue;
          peers.push_back(peer);
          epoll_event add{EPOLLIN, {.fd = peer}};
          epoll_ctl(epoll, EPOLL_CTL_ADD, peer, &add);
          continue;
        }
        for (;;) {
          size_t length = 0;
          const tarvod::ReceiveStatus status = tarvod::ReceivePacket(fd, buffer, &length);
          if (status == tarvod::ReceiveStatus::kWouldBlock) break;
          if (status != tarvod::ReceiveStatus::kMessage) {
            epoll_ctl(epoll, EPOLL_CTL_DEL, fd, nullptr);
            break;
          }
          const std::string& line = lines[received % lines.size()];
          const int out =
              keepOpen ? kept
                       : open(output.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
          [[maybe_unused]] ssize_t w = write(out, line.data(), line.size());
          if (!keepOpen) close(out);
          ++received;
        }
      }
    }
    if (kept >= 0) close(kept);
    for (int peer : peers) close(peer);
    close(epoll);
  });
  const Clock::time_point start = Clock::now();
  SendAll(socketPath, packets, 0, nullptr);
  server.join();
  const double elapsed = Seconds(Clock::now() - start);
  close(listener.fd);
  unlink(socketPath.c_str());
  return static_cast<double>(total) / elapsed;
}

// ---- SEC ----

std::optional<double> RunSec(const std::string& directory, size_t events, size_t expectedLines) {
  const std::string output = directory + "/sec.log";
  const std::string rules = directory + "/auth.sec";
  std::filesystem::remove(output);
  // criterion 1: protocolName equal "SSH"; criterion 2: username notequal "root".
  WriteFile(rules,
            "type=Single\n"
            "ptype=RegExp\n"
            "pattern=^auth\\.failure source=\\S+ protocolName=SSH username=(?!root )(\\S+) "
            "clientIP=(\\S+) message=(.*)$\n"
            "desc=failed login\n"
            "action=write " +
                output + " failed login for $1 from $2: $3\n");
  const Clock::time_point start = Clock::now();
  const pid_t child = fork();
  if (child == 0) {
    const int null = open("/dev/null", O_WRONLY);
    dup2(null, STDOUT_FILENO);
    dup2(null, STDERR_FILENO);
    const std::string conf = "--conf=" + rules;
    const std::string input = "--input=" + directory + "/events.txt";
    execlp("sec", "sec", conf.c_str(), input.c_str(), "--notail", "--nointevents",
           "--log=/dev/null", static_cast<char*>(nullptr));
    _exit(127);
  }
  int status = 0;
  waitpid(child, &status, 0);
  const double elapsed = Seconds(Clock::now() - start);
  if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) return std::nullopt;
  const size_t written = LineCounter(output).poll();
  if (written != expectedLines) {
    std::fprintf(stderr, "sec wrote %zu of %zu lines\n", written, expectedLines);
  }
  return static_cast<double>(events) / elapsed;
}

// ---- the daemon ----

// CPU nanoseconds per thread name, summed over the threads of that name.
std::map<std::string, uint64_t> ThreadCpu(pid_t pid) {
  std::map<std::string, uint64_t> cpu;
  const std::string tasks = "/proc/" + std::to_string(pid) + "/task";
  std::error_code error;
  for (const auto& task : std::filesystem::directory_iterator(tasks, error)) {
    std::ifstream commFile(task.path() / "comm");
    std::ifstream schedFile(task.path() / "schedstat");
    std::string comm;
    uint64_t ns = 0;
    if (std::getline(commFile, comm) && (schedFile >> ns)) cpu[comm] += ns;
  }
  return cpu;
}

// The daemon's pid: with a wrapper in front it is the wrapper's child.
pid_t DaemonPid(pid_t launched, bool wrapped) {
  if (!wrapped) return launched;
  for (int i = 0; i < 500; ++i) {
    std::ifstream in("/proc/" + std::to_string(launched) + "/task/" + std::to_string(launched) +
                     "/children");
    pid_t child = 0;
    if (in >> child) return child;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return launched;
}

struct DaemonResult {
  double eventsPerSecond = 0;
  double p50us = 0;
  double p99us = 0;
  long peakRssKb = 0;
  std::map<std::string, double> cpuPerEventUs;  // by thread name
  bool complete = false;
};

std::optional<DaemonResult> RunDaemon(const std::string& binary, const std::string& directory,
                                      const std::vector<std::string>& packets,
                                      const std::vector<std::string>& latencyPackets, double rate,
                                      bool keepLogFilesOpen) {
  const std::string socketPath = directory + "/evtq";
  const std::string output = directory + "/auth.log";
  const std::string records = directory + "/records.jsonl";
  std::filesystem::remove(output);
  std::filesystem::remove(records);
  std::filesystem::remove_all(directory + "/state");
  WriteFile(directory + "/tarvod.plist",
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
            "<key>config</key><dict>"
            "<key>errorLogPath</key>" +
                XmlString(directory + "/error.log") +
                "<key>debugLevel</key><integer>0</integer>"
                "<key>structuredLogPath</key>" +
                XmlString(records) + "<key>stateDirectory</key>" + XmlString(directory + "/state") +
                "<key>eventSocketPath</key>" + XmlString(socketPath) +
                "<key>authLogSource</key><string>none</string>" +
                (keepLogFilesOpen ? "<key>keepLogFilesOpen</key><true/>" : "") +
                "</dict></dict></plist>\n");
  WriteFile(directory + "/rules.plist",
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><array><dict>"
            "<key>name</key><string>failed login</string>"
            "<key>eventTypes</key><array><string>auth</string></array>"
            "<key>criterion</key><array>"
            "<dict><key>operator</key><string>equal</string><key>operands</key><array>"
            "<string>${event:protocolName}</string><string>SSH</string></array></dict>"
            "<dict><key>operator</key><string>notequal</string><key>operands</key><array>"
            "<string>${event:username}</string><string>root</string></array></dict>"
            "</array>"
            "<key>actions</key><array><dict><key>type</key><string>log</string>"
            "<key>message</key><string>failed login for ${event:username} from "
            "${event:clientIP}: ${event:message}</string>"
            "<key>logPath</key>" +
                XmlString(output) + "</dict></array></dict></array></plist>\n");

  std::vector<std::string> command;
  if (const char* wrap = std::getenv("TARVOD_BENCH_WRAP")) {
    std::istringstream words(wrap);
    for (std::string w; words >> w;) command.push_back(w);
  }
  const bool wrapped = !command.empty();
  for (const char* a : {"-c", "", "-r", "", "-n"}) command.push_back(a);
  command.insert(command.end() - 5, binary);
  command[command.size() - 4] = directory + "/tarvod.plist";
  command[command.size() - 2] = directory + "/rules.plist";
  const pid_t launched = fork();
  if (launched == 0) {
    std::vector<char*> argv;
    for (std::string& word : command) argv.push_back(word.data());
    argv.push_back(nullptr);
    execvp(argv[0], argv.data());
    _exit(127);
  }
  for (int i = 0; i < 1000 && !std::filesystem::exists(socketPath); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  const pid_t daemon = DaemonPid(launched, wrapped);
  DaemonResult result;

  // Throughput.
  const size_t total = packets.size();
  // The rule fires for every user but root; each event leaves two records.
  const size_t expectedLines = FiringEvents(0, total);
  LineCounter lineCounter(output);
  LineCounter recordCounter(records);
  // The records already there (the startup event's) are not the workload's.
  const size_t earlierRecords = recordCounter.poll();
  const auto cpuBefore = ThreadCpu(daemon);
  const Clock::time_point start = Clock::now();
  std::thread sender([&] { SendAll(socketPath, packets, 0, nullptr); });
  const Clock::time_point giveUp = start + std::chrono::seconds(120);
  size_t lines = 0, recordLines = 0;
  while (Clock::now() < giveUp) {
    lines = lineCounter.poll();
    recordLines = recordCounter.poll();
    if (lines >= expectedLines && recordLines >= earlierRecords + 2 * total) break;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  const double elapsed = Seconds(Clock::now() - start);
  sender.join();
  const auto cpuAfter = ThreadCpu(daemon);
  recordLines -= earlierRecords;
  result.complete = lines == expectedLines && recordLines == 2 * total;
  if (!result.complete) {
    std::fprintf(stderr, "tarvod: %zu of %zu lines, %zu of %zu records\n", lines, expectedLines,
                 recordLines, 2 * total);
  }
  result.eventsPerSecond = static_cast<double>(total) / elapsed;
  for (const auto& [name, ns] : cpuAfter) {
    const auto before = cpuBefore.find(name);
    const uint64_t spent = ns - (before == cpuBefore.end() ? 0 : before->second);
    result.cpuPerEventUs[name] = static_cast<double>(spent) / 1000.0 / static_cast<double>(total);
  }

  // Latency at a fixed rate, from the send to the line's appearance.
  if (!latencyPackets.empty()) {
    std::vector<Clock::time_point> sentAt(latencyPackets.size());
    std::vector<Clock::time_point> seenAt(latencyPackets.size());
    const long firstSequence = static_cast<long>(total);
    const size_t expected = FiringEvents(total, latencyPackets.size());
    const int inotify = inotify_init1(IN_CLOEXEC);
    inotify_add_watch(inotify, output.c_str(), IN_MODIFY);
    const int fd = open(output.c_str(), O_RDONLY | O_CLOEXEC);
    uint64_t offset = static_cast<uint64_t>(lseek(fd, 0, SEEK_END));
    std::thread latencySender([&] { SendAll(socketPath, latencyPackets, rate, &sentAt); });
    std::string pending;
    size_t seen = 0;
    const Clock::time_point latencyGiveUp =
        Clock::now() + std::chrono::seconds(30) +
        std::chrono::duration_cast<Clock::duration>(
            std::chrono::duration<double>(static_cast<double>(latencyPackets.size()) / rate));
    while (seen < expected && Clock::now() < latencyGiveUp) {
      pollfd wait{inotify, POLLIN, 0};
      if (poll(&wait, 1, 100) > 0) {
        char events[4096];
        [[maybe_unused]] ssize_t r = read(inotify, events, sizeof events);
      }
      char buffer[1 << 16];
      ssize_t n;
      while ((n = pread(fd, buffer, sizeof buffer, static_cast<off_t>(offset))) > 0) {
        const Clock::time_point now = Clock::now();
        offset += static_cast<uint64_t>(n);
        pending.append(buffer, static_cast<size_t>(n));
        size_t newline;
        while ((newline = pending.find('\n')) != std::string::npos) {
          const long sequence = SequenceOf(std::string_view(pending).substr(0, newline));
          pending.erase(0, newline + 1);
          const long index = sequence - firstSequence;
          if (index >= 0 && static_cast<size_t>(index) < seenAt.size()) seenAt[index] = now;
          ++seen;
        }
      }
    }
    latencySender.join();
    close(fd);
    close(inotify);
    std::vector<double> latencies;
    for (size_t i = 0; i < latencyPackets.size(); ++i) {
      if (seenAt[i] == Clock::time_point{}) continue;
      latencies.push_back(std::chrono::duration<double, std::micro>(seenAt[i] - sentAt[i]).count());
    }
    std::sort(latencies.begin(), latencies.end());
    if (latencies.size() != expected) {
      std::fprintf(stderr, "tarvod: %zu of %zu lines at the fixed rate\n", latencies.size(),
                   expected);
      result.complete = false;
    }
    if (!latencies.empty()) {
      result.p50us = latencies[latencies.size() / 2];
      result.p99us = latencies[latencies.size() * 99 / 100];
    }
  }
  result.peakRssKb = ProcStatusKb(daemon, "VmHWM:");
  kill(daemon, SIGTERM);
  int status = 0;
  waitpid(launched, &status, 0);
  return result;
}

double Median(std::vector<double> values) {
  if (values.empty()) return 0;
  std::sort(values.begin(), values.end());
  return values[values.size() / 2];
}

std::string LoadAverage() {
  std::ifstream in("/proc/loadavg");
  std::string a, b, c;
  in >> a >> b >> c;
  return a + " " + b + " " + c;
}

}  // namespace

int main(int argc, char** argv) {
  size_t events = 100000;
  size_t latencyEvents = 20000;
  double rate = 10000;
  int repeat = 3;
  std::string only;
  std::string binary = TARVOD_BINARY_PATH;
  std::string baseline;
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string option = argv[i];
    const std::string value = argv[i + 1];
    if (option == "--events")
      events = std::stoul(value);
    else if (option == "--latency-events")
      latencyEvents = std::stoul(value);
    else if (option == "--rate")
      rate = std::stod(value);
    else if (option == "--repeat")
      repeat = std::stoi(value);
    else if (option == "--only")
      only = "," + value + ",";
    else if (option == "--binary")
      binary = value;
    else if (option == "--baseline")
      baseline = value;
    else {
      std::fprintf(stderr, "unknown option %s\n", option.c_str());
      return 2;
    }
  }
  const auto wanted = [&](const char* name) {
    return only.empty() || only.find("," + std::string(name) + ",") != std::string::npos;
  };

  char pattern[] = "/tmp/tarvod-e2e-XXXXXX";
  const std::string directory = mkdtemp(pattern);
  std::vector<std::string> packets, latencyPackets, lines;
  std::string text;
  for (size_t i = 0; i < events + latencyEvents; ++i) {
    const Event e = MakeEvent(i);
    std::string packet = EventPacket(e, 7.5e8 + static_cast<double>(i) / 1000.0);
    if (i < events) {
      packets.push_back(std::move(packet));
      text += EventText(e);
      lines.push_back(LogLine(e));
    } else {
      latencyPackets.push_back(std::move(packet));
    }
  }
  WriteFile(directory + "/events.txt", text);
  // The packets are what the daemon reads: check the first one.
  const std::optional<plist::Value> decoded = plist::ReadPropertyList(packets.front());
  if (!decoded || !decoded->isDictionary()) {
    std::fprintf(stderr, "the prepared packet does not read back\n");
    return 1;
  }

  std::printf("events %zu over %d connections; latency: %zu events at %.0f/s; %d runs; load %s\n",
              events, kConnections, latencyEvents, rate, repeat, LoadAverage().c_str());
  std::map<std::string, std::vector<double>> rates, p50, p99, rss;
  std::map<std::string, std::map<std::string, std::vector<double>>> cpu;
  for (int run = 0; run < repeat; ++run) {
    if (wanted("floor-open"))
      rates["floor-open"].push_back(RunFloor(directory, packets, lines, false));
    if (wanted("floor-kept"))
      rates["floor-kept"].push_back(RunFloor(directory, packets, lines, true));
    if (wanted("sec")) {
      if (const std::optional<double> r = RunSec(directory, events, FiringEvents(0, events))) {
        rates["sec"].push_back(*r);
      }
    }
    struct Variant {
      const char* name;
      std::string binary;
      bool kept;
    };
    std::vector<Variant> variants = {{"tarvod", binary, false}, {"tarvod-kept", binary, true}};
    if (!baseline.empty()) variants.insert(variants.begin(), {"baseline", baseline, false});
    for (const auto& [name, variantBinary, kept] : variants) {
      if (!wanted(name)) continue;
      const std::optional<DaemonResult> r =
          RunDaemon(variantBinary, directory, packets, latencyPackets, rate, kept);
      if (!r) continue;
      if (!r->complete) std::fprintf(stderr, "%s: incomplete run\n", name);
      rates[name].push_back(r->eventsPerSecond);
      p50[name].push_back(r->p50us);
      p99[name].push_back(r->p99us);
      rss[name].push_back(static_cast<double>(r->peakRssKb));
      for (const auto& [thread, us] : r->cpuPerEventUs) cpu[name][thread].push_back(us);
    }
    std::fprintf(stderr, "run %d done (load %s)\n", run + 1, LoadAverage().c_str());
  }

  const double secRate = Median(rates["sec"]);
  const double floorOpen = Median(rates["floor-open"]);
  std::printf("\n%-12s %12s %8s %8s %9s %9s %8s\n", "", "events/s", "xSEC", "xfloor", "p50 us",
              "p99 us", "RSS kB");
  for (const char* name :
       {"floor-open", "floor-kept", "sec", "baseline", "tarvod", "tarvod-kept"}) {
    if (rates[name].empty()) continue;
    const double r = Median(rates[name]);
    std::printf("%-12s %12.0f %8.2f %8.2f", name, r, secRate > 0 ? r / secRate : 0,
                floorOpen > 0 ? r / floorOpen : 0);
    if (!p50[name].empty()) {
      std::printf(" %9.0f %9.0f %8.0f", Median(p50[name]), Median(p99[name]), Median(rss[name]));
    }
    std::printf("\n");
  }
  for (const auto& [name, threads] : cpu) {
    std::printf("\nCPU per event, %s (us, median of runs):", name.c_str());
    for (const auto& [thread, values] : threads) {
      std::printf("  %s %.2f", thread.c_str(), Median(values));
    }
    std::printf("\n");
  }
  std::printf("load at the end: %s\n", LoadAverage().c_str());
  std::filesystem::remove_all(directory);
  return 0;
}
