// Host statistics: the memory figures of the "system:" variables, the host name and address.
// InitHostStats runs once at startup; the rest may be called from any thread.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

namespace tarvod {

// Counters 0 to 3 are free, active, inactive and wired pages (from /proc/meminfo's MemFree,
// Active, Inactive and Unevictable, converted from kB to pages).
struct StatContext {
  uint32_t counters[15] = {};
  uint32_t count = 0;
};

// Records the page size. Called once before the first context.
void InitHostStats();
uint64_t HostPageSize();
// A filled snapshot, or nullptr when the host query failed.
std::unique_ptr<StatContext> CreateStatContext();
// Fills stats; returns the number of counters filled, 0 on failure.
uint32_t FetchVMStats(StatContext& stats);
// Reads another file instead of /proc/meminfo (tests); an empty path restores the default.
void SetMeminfoPathForTesting(const std::string& path);

std::string HostName();
// The first non-loopback IPv4 address, dotted; nullopt when there is none.
std::optional<std::string> HostIPv4Address();

}  // namespace tarvod
