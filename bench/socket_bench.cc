// The event socket end to end: N events over K connections into the real daemon, through a
// rule with two criteria and a file log action. Reports events per second, the p50 and p99
// latency from send to the line in the file, and the daemon's peak resident memory, next to
// the same machine's figure for the socket alone (a server that only reads the packets).
#include <benchmark/benchmark.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/epoll.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/seqpacket.h"
#include "process_status.h"

using tarvod::bench::ProcStatusKb;
using tarvod::bench::XmlString;

namespace {

using Clock = std::chrono::steady_clock;

std::string Message(int sender, int index) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
         "<key>eventType</key><string>bench.event</string><key>eventDetails</key><dict>"
         "<key>kind</key><string>login</string><key>n</key><integer>" +
         std::to_string(index) + "</integer><key>id</key><string>" + std::to_string(sender) + "-" +
         std::to_string(index) + "</string></dict></dict></plist>\n";
}

// Sends perConnection events on each of connections connections, concurrently; records the
// send time of each event under its "sender-index" id.
void SendAll(const std::string& path, int connections, int perConnection,
             std::vector<std::vector<Clock::time_point>>* sentAt) {
  sentAt->assign(connections, std::vector<Clock::time_point>(perConnection));
  std::vector<std::thread> senders;
  for (int c = 0; c < connections; ++c) {
    senders.emplace_back([&, c] {
      const tarvod::SocketResult connection = tarvod::ConnectSeqpacket(path);
      if (connection.fd < 0) return;
      std::string error;
      for (int i = 0; i < perConnection; ++i) {
        (*sentAt)[c][i] = Clock::now();
        if (!tarvod::SendPacket(connection.fd, Message(c, i), &error)) break;
      }
      close(connection.fd);
    });
  }
  for (auto& t : senders) t.join();
}

// The socket alone: a server thread that accepts and reads packets, nothing more.
void BM_SocketAlone(benchmark::State& state) {
  const int connections = static_cast<int>(state.range(0));
  const int total = static_cast<int>(state.range(1));
  char pattern[] = "/tmp/tarvod-bench-XXXXXX";
  const std::string directory = mkdtemp(pattern);
  const std::string path = directory + "/evtq";
  for (auto _ : state) {
    tarvod::SocketResult listener = tarvod::ListenSeqpacket(path, 128);
    std::atomic<int> received{0};
    std::thread server([&] {
      const int epoll = epoll_create1(EPOLL_CLOEXEC);
      epoll_event event{EPOLLIN, {.fd = listener.fd}};
      epoll_ctl(epoll, EPOLL_CTL_ADD, listener.fd, &event);
      std::vector<uint8_t> buffer(1024 * 1024);
      std::vector<int> peers;
      while (received < total) {
        epoll_event ready[16];
        const int n = epoll_wait(epoll, ready, 16, 1000);
        for (int i = 0; i < n; ++i) {
          if (ready[i].data.fd == listener.fd) {
            const int peer = tarvod::AcceptSeqpacket(listener.fd);
            if (peer < 0) continue;
            peers.push_back(peer);
            epoll_event add{EPOLLIN, {.fd = peer}};
            epoll_ctl(epoll, EPOLL_CTL_ADD, peer, &add);
            continue;
          }
          size_t length = 0;
          if (tarvod::ReceivePacket(ready[i].data.fd, buffer, &length) ==
              tarvod::ReceiveStatus::kMessage) {
            ++received;
          } else {
            epoll_ctl(epoll, EPOLL_CTL_DEL, ready[i].data.fd, nullptr);
          }
        }
      }
      for (int peer : peers) close(peer);
      close(epoll);
    });
    std::vector<std::vector<Clock::time_point>> sentAt;
    SendAll(path, connections, total / connections, &sentAt);
    server.join();
    close(listener.fd);
    unlink(path.c_str());
  }
  state.SetItemsProcessed(state.iterations() * total);
  std::filesystem::remove_all(directory);
}

// The daemon end to end.
void BM_DaemonEndToEnd(benchmark::State& state) {
  const int connections = static_cast<int>(state.range(0));
  const int total = static_cast<int>(state.range(1));
  const int perConnection = total / connections;
  char pattern[] = "/tmp/tarvod-bench-XXXXXX";
  const std::string directory = mkdtemp(pattern);
  const std::string socketPath = directory + "/evtq";
  const std::string output = directory + "/events.log";
  {
    std::ofstream(directory + "/tarvod.plist")
        << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
           "<key>config</key><dict><key>errorLogPath</key>"
        << XmlString(directory + "/error.log") << "<key>structuredLogPath</key>"
        << XmlString(directory + "/records.jsonl") << "<key>stateDirectory</key>"
        << XmlString(directory + "/state") << "<key>eventSocketPath</key>" << XmlString(socketPath)
        << "</dict></dict></plist>\n";
    std::ofstream(directory + "/rules.plist")
        << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><array><dict>"
           "<key>name</key><string>bench</string><key>eventTypes</key><array>"
           "<string>bench.event</string></array><key>criterion</key><array>"
           "<dict><key>operator</key><string>equal</string><key>operands</key><array>"
           "<string>${event:kind}</string><string>login</string></array></dict>"
           "<dict><key>operator</key><string>greaterthanequal</string><key>operands</key><array>"
           "<string>${event:n}</string><integer>0</integer></array></dict></array>"
           "<key>actions</key><array><dict><key>type</key><string>log</string>"
           "<key>message</key><string>${event:id}</string><key>logPath</key>"
        << XmlString(output) << "</dict></array></dict></array></plist>\n";
  }
  const std::string config = directory + "/tarvod.plist";
  const std::string rules = directory + "/rules.plist";
  const pid_t daemon = fork();
  if (daemon == 0) {
    execl(TARVOD_BINARY_PATH, "tarvod", "-c", config.c_str(), "-r", rules.c_str(), "-n",
          static_cast<char*>(nullptr));
    _exit(127);
  }
  for (int i = 0; i < 500 && !std::filesystem::exists(socketPath); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }

  std::vector<double> latencies;
  for (auto _ : state) {
    std::filesystem::remove(output);
    std::vector<std::vector<Clock::time_point>> sentAt(
        connections, std::vector<Clock::time_point>(perConnection));
    std::vector<std::vector<Clock::time_point>> seenAt = sentAt;
    // The tailer gives up two minutes after the last send, should events go missing.
    std::atomic<bool> done{false};
    std::atomic<Clock::rep> giveUpAt{0};
    // The tailer reads the file as it grows and notes when each id's line appears.
    std::thread tailer([&] {
      size_t offset = 0;
      int seen = 0;
      std::string pending;
      while (seen < connections * perConnection) {
        std::ifstream in(output, std::ios::binary);
        if (in) {
          in.seekg(static_cast<std::streamoff>(offset));
          std::string chunk((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
          offset += chunk.size();
          pending += chunk;
          const auto now = Clock::now();
          size_t newline;
          while ((newline = pending.find('\n')) != std::string::npos) {
            const std::string id = pending.substr(0, newline);
            pending.erase(0, newline + 1);
            const size_t dash = id.find('-');
            if (dash == std::string::npos) continue;
            const int c = std::atoi(id.c_str());
            const int i = std::atoi(id.c_str() + dash + 1);
            if (c >= 0 && c < connections && i >= 0 && i < perConnection) seenAt[c][i] = now;
            ++seen;
          }
        }
        if (done && Clock::now().time_since_epoch().count() > giveUpAt) break;
        std::this_thread::sleep_for(std::chrono::microseconds(500));
      }
    });
    const auto start = Clock::now();
    SendAll(socketPath, connections, perConnection, &sentAt);
    giveUpAt = (Clock::now() + std::chrono::minutes(2)).time_since_epoch().count();
    done = true;
    tailer.join();
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
    for (int c = 0; c < connections; ++c) {
      for (int i = 0; i < perConnection; ++i) {
        latencies.push_back(
            std::chrono::duration<double, std::micro>(seenAt[c][i] - sentAt[c][i]).count());
      }
    }
  }
  std::sort(latencies.begin(), latencies.end());
  if (!latencies.empty()) {
    state.counters["p50_us"] = latencies[latencies.size() / 2];
    state.counters["p99_us"] = latencies[latencies.size() * 99 / 100];
  }
  state.counters["peak_rss_kB"] = static_cast<double>(ProcStatusKb(daemon, "VmHWM:"));
  state.SetItemsProcessed(state.iterations() * connections * perConnection);
  kill(daemon, SIGTERM);
  waitpid(daemon, nullptr, 0);
  std::filesystem::remove_all(directory);
}

}  // namespace

BENCHMARK(BM_SocketAlone)
    ->Args({1, 20000})
    ->Args({8, 40000})
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond);
BENCHMARK(BM_DaemonEndToEnd)
    ->Args({1, 20000})
    ->Args({8, 40000})
    ->UseManualTime()
    ->Iterations(1)
    ->Unit(benchmark::kMillisecond);
