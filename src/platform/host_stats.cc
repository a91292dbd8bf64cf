#include "platform/host_stats.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <limits.h>
#include <net/if.h>
#include <netinet/in.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstring>
#include <mutex>

namespace tarvod {
namespace {

constexpr const char* kDefaultMeminfoPath = "/proc/meminfo";
// /proc/meminfo is a few kilobytes; a file standing in for it is read no further than this.
constexpr size_t kMaxMeminfoBytes = 64 * 1024;

std::atomic<uint64_t> gPageSize{0};

std::mutex gPathLock;
std::string gMeminfoPath = kDefaultMeminfoPath;

std::string MeminfoPath() {
  std::lock_guard<std::mutex> lock(gPathLock);
  return gMeminfoPath;
}

uint64_t QueryPageSize() {
  const long size = sysconf(_SC_PAGESIZE);
  return size > 0 ? static_cast<uint64_t>(size) : 4096;
}

// "Name:   1234 kB" -> 1234 when the line names the field; nullopt otherwise.
std::optional<uint64_t> FieldKilobytes(const char* line, const char* name) {
  const size_t length = std::strlen(name);
  if (std::strncmp(line, name, length) != 0 || line[length] != ':') return std::nullopt;
  const char* p = line + length + 1;
  while (*p == ' ' || *p == '\t') ++p;
  if (*p < '0' || *p > '9') return std::nullopt;
  uint64_t value = 0;
  for (; *p >= '0' && *p <= '9'; ++p) {
    if (value > (UINT64_MAX - 9) / 10) return std::nullopt;
    value = value * 10 + static_cast<uint64_t>(*p - '0');
  }
  return value;
}

}  // namespace

void InitHostStats() { gPageSize.store(QueryPageSize()); }

uint64_t HostPageSize() {
  uint64_t size = gPageSize.load();
  if (size == 0) {
    size = QueryPageSize();
    gPageSize.store(size);
  }
  return size;
}

std::unique_ptr<StatContext> CreateStatContext() {
  auto stats = std::make_unique<StatContext>();
  const uint32_t count = FetchVMStats(*stats);
  if (count == 0) return nullptr;
  stats->count = count;
  return stats;
}

// Fills counters 0 to 3 (free, active, inactive, wired) and returns 4; the other counters of
// the record stay zero. All four fields must be present, else the query has failed.
uint32_t FetchVMStats(StatContext& stats) {
  const std::string path = MeminfoPath();
  FILE* file = std::fopen(path.c_str(), "re");
  if (file == nullptr) return 0;
  static constexpr const char* kFields[4] = {"MemFree", "Active", "Inactive", "Unevictable"};
  std::optional<uint64_t> kilobytes[4];
  char line[256];
  size_t consumed = 0;
  while (consumed < kMaxMeminfoBytes && std::fgets(line, sizeof line, file) != nullptr) {
    consumed += std::strlen(line);
    for (int f = 0; f < 4; ++f) {
      if (!kilobytes[f]) kilobytes[f] = FieldKilobytes(line, kFields[f]);
    }
  }
  std::fclose(file);
  for (const auto& k : kilobytes) {
    if (!k) return 0;
  }
  const uint64_t pageSize = HostPageSize();
  for (int f = 0; f < 4; ++f) {
    const uint64_t pages =
        *kilobytes[f] / pageSize * 1024 + (*kilobytes[f] % pageSize) * 1024 / pageSize;
    stats.counters[f] = pages > UINT32_MAX ? UINT32_MAX : static_cast<uint32_t>(pages);
  }
  return 4;
}

void SetMeminfoPathForTesting(const std::string& path) {
  std::lock_guard<std::mutex> lock(gPathLock);
  gMeminfoPath = path.empty() ? kDefaultMeminfoPath : path;
}

std::string HostName() {
  char name[HOST_NAME_MAX + 1] = {};
  if (gethostname(name, sizeof name - 1) != 0) return std::string();
  return name;
}

std::optional<std::string> HostIPv4Address() {
  struct ifaddrs* list = nullptr;
  if (getifaddrs(&list) != 0) return std::nullopt;
  std::optional<std::string> result;
  for (const struct ifaddrs* entry = list; entry != nullptr; entry = entry->ifa_next) {
    if (entry->ifa_addr == nullptr || entry->ifa_addr->sa_family != AF_INET) continue;
    if ((entry->ifa_flags & IFF_LOOPBACK) != 0 || (entry->ifa_flags & IFF_UP) == 0) continue;
    const auto* address = reinterpret_cast<const struct sockaddr_in*>(entry->ifa_addr);
    char text[INET_ADDRSTRLEN] = {};
    if (inet_ntop(AF_INET, &address->sin_addr, text, sizeof text) == nullptr) continue;
    result = text;
    break;
  }
  freeifaddrs(list);
  return result;
}

}  // namespace tarvod
