// The SSH log line parser: lines per second over a mix of the forms sshd writes.
#include <benchmark/benchmark.h>

#include <array>

#include "sources/ssh_log.h"

namespace tarvod {
namespace {

void BM_ParseSshLogLine(benchmark::State& state) {
  static const std::array<const char*, 6> kLines = {
      "Failed password for invalid user admin from 192.0.2.7 port 51234 ssh2",
      "Accepted publickey for alice from 2001:db8::1 port 22 ssh2: ED25519 SHA256:Zm9vYmFy",
      "Connection closed by authenticating user root 192.0.2.8 port 4022 [preauth]",
      "pam_unix(sshd:auth): authentication failure; logname= uid=0 euid=0 tty=ssh ruser= "
      "rhost=192.0.2.9  user=root",
      "Received disconnect from 192.0.2.7 port 51234:11: Bye Bye [preauth]",
      "Invalid user oracle from 198.51.100.4 port 40000",
  };
  size_t i = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(ParseSshLogLine(kLines[i++ % kLines.size()]));
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_ParseSshLogLine);

}  // namespace
}  // namespace tarvod
