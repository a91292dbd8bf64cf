// Builtin variables: values computed on each lookup from the clock, the host and the
// context's statistics snapshot.

#include "context/builtins.h"

#include <chrono>
#include <cinttypes>
#include <cstdio>
#include <vector>

#include "context/context.h"
#include "platform/diagnostic_log.h"

namespace tarvod {
namespace {

std::string FormatSeconds(double seconds) {
  char buffer[512];
  std::snprintf(buffer, sizeof buffer, "%f", seconds);
  return buffer;
}

}  // namespace

double SecondsSince2001Now() {
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  return std::chrono::duration<double>(now).count() - plist::kUnixTimeOfReferenceDate;
}

double ParseInterval(std::string_view interval, bool forward) {
  std::vector<std::string_view> parts;
  size_t start = 0;
  while (true) {
    const size_t colon = interval.find(':', start);
    parts.push_back(
        interval.substr(start, colon == std::string_view::npos ? colon : colon - start));
    if (colon == std::string_view::npos || parts.size() > 3) break;
    start = colon + 1;
  }
  if (parts.size() != 3) {
    const std::string text(interval);
    LogMessage(0, "ParseInterval: interval string is malformed, expecting  HH:MM:SS.SSS got %s",
               text.c_str());
    return 0;
  }
  // No range limits: 90 minutes or negative parts are taken as the numbers they are.
  const double hours = static_cast<double>(plist::LeadingInteger(parts[0]));
  const double minutes = static_cast<double>(plist::LeadingInteger(parts[1]));
  const double seconds = plist::LeadingNumber(parts[2]);
  const double total = hours * 3600 + minutes * 60 + seconds;
  return forward ? total : -total;
}

std::string SystemStatForKey(std::string_view key, const StatContext& stats) {
  constexpr std::string_view kMemory = "system:memory:";
  if (!key.starts_with(kMemory)) return "not-implemented";
  const uint64_t pageSize = HostPageSize();
  const uint64_t freePages = stats.counters[0];
  const uint64_t active = stats.counters[1];
  const uint64_t inactive = stats.counters[2];
  const uint64_t wired = stats.counters[3];
  // Keys are matched by their ending, in this order: "unused" reads as "used", and
  // "inactive" is tested before "active".
  uint64_t pages = 0;
  if (key.ends_with("free")) {
    pages = freePages;
  } else if (key.ends_with("installed")) {
    return "not-implemented";
  } else if (key.ends_with("used")) {
    pages = active + inactive + wired;
  } else if (key.ends_with("wired")) {
    pages = wired;
  } else if (key.ends_with("inactive")) {
    pages = inactive;
  } else if (key.ends_with("active")) {
    pages = active;
  } else {
    return "not-implemented";  // "pageins", "pageouts" and every other key
  }
  char buffer[32];
  std::snprintf(buffer, sizeof buffer, "%" PRIu64, pages * pageSize);
  return buffer;
}

std::optional<plist::Value> Context::valueForBuiltinVariableKey(std::string_view key) {
  if (key == "now") return plist::Value(FormatSeconds(SecondsSince2001Now()));
  if (key.starts_with("now")) {
    // The character after "now" is the sign: "+" forward, anything else backward.
    const bool forward = key.size() > 3 && key[3] == '+';
    const double offset =
        ParseInterval(key.size() > 4 ? key.substr(4) : std::string_view(), forward);
    return plist::Value(FormatSeconds(SecondsSince2001Now() + offset));
  }
  if (key == "hostName") return plist::Value(HostName());
  // There is no separate IPv6 look-up: "hostIPv6" gives the IPv4 address too. A host without
  // a non-loopback IPv4 address has no value for either.
  if (key == "hostIP" || key == "hostIPv6") {
    auto address = HostIPv4Address();
    if (!address) return std::nullopt;
    return plist::Value(std::move(*address));
  }
  if (key.starts_with("system:")) {
    const StatContext* snapshot = stats();
    if (snapshot == nullptr) return plist::Value("rule-error");
    return plist::Value(SystemStatForKey(key, *snapshot));
  }
  if (key == "eventDictionary") {
    if (event() == nullptr) return std::nullopt;
    return plist::Value(*event());
  }
  if (key == "event") {
    if (event() == nullptr) return std::nullopt;
    return plist::Value(plist::Describe(*event()));
  }
  return std::nullopt;
}

}  // namespace tarvod
