#include "daemon/control.h"

#include <chrono>
#include <cinttypes>
#include <cstdio>

#include "engine/stats.h"
#include "platform/clock.h"

namespace tarvod {
namespace {

// The action keywords by code, as the counters are kept.
constexpr const char* kActionNames[EngineStats::kActionCodes] = {"nullaction", "",
                                                                 "",           "log",
                                                                 "sendemail",  "sendmessage",
                                                                 "sendqe",     "postnotification",
                                                                 "sendpage",   "sendsms",
                                                                 "runcommand", "addtodb",
                                                                 "publishrss", "debugdump"};

double MonotonicNow() {
  return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

std::string Json(std::string_view text) {
  std::string out = "\"";
  for (const char c : text) {
    if (c == '"' || c == '\\') {
      out += '\\';
      out += c;
    } else if (static_cast<unsigned char>(c) < 0x20) {
      char escape[8];
      std::snprintf(escape, sizeof escape, "\\u%04x", c);
      out += escape;
    } else {
      out += c;
    }
  }
  return out + "\"";
}

std::string Number(double value) {
  char buffer[32];
  std::snprintf(buffer, sizeof buffer, "%.6f", value);
  return buffer;
}

// The daemon's own events (startup, reload, shutdown) are the ones no source delivered.
std::string PerSource(const Monitor* monitor) {
  using Source = Monitor::EventSource;
  constexpr std::pair<Source, const char*> kSources[] = {{Source::kSocket, "socket"},
                                                         {Source::kSshLogins, "sshLogins"},
                                                         {Source::kNotifications, "notifications"},
                                                         {Source::kPeriodic, "periodic"}};
  std::string out = "{";
  uint64_t delivered = 0;
  for (const auto& [source, name] : kSources) {
    const uint64_t count = monitor ? monitor->eventsFrom(source) : 0;
    delivered += count;
    out += "\"" + std::string(name) + "\": " + std::to_string(count) + ", ";
  }
  const uint64_t all = Statistics().events();
  return out + "\"daemon\": " + std::to_string(all > delivered ? all - delivered : 0) + "}";
}

std::string Stats(const DaemonFigures& figures, Engine& engine, const Monitor* monitor) {
  const double lastReload = figures.lastReload.load();
  std::string out = "{\n  \"uptime\": " + Number(MonotonicNow() - figures.startedAt) +
                    ",\n  \"rulesLoaded\": " + std::to_string(figures.rulesLoaded.load()) +
                    ",\n  \"lastReload\": " +
                    (lastReload > 0 ? Json(plist::FormatDate(plist::Date{lastReload}, false))
                                    : std::string("null")) +
                    ",\n  \"events\": " + std::to_string(Statistics().events()) +
                    ",\n  \"eventsPerSource\": " + PerSource(monitor) +
                    ",\n  \"eventsPerTypePrefix\": {";
  const char* separator = "";
  // Counted since the rules were last loaded.
  for (const auto& [type, entry] : *engine.rulebase()) {
    out += separator + std::string("\n    ") + Json(type) + ": " +
           std::to_string(entry.eventCounter.load(std::memory_order_relaxed));
    separator = ",";
  }
  out += "\n  },\n  \"rules\": [";
  separator = "";
  for (const RuleStats& rule : Statistics().rules()) {
    out += separator + std::string("\n    {\"name\": ") + Json(rule.name) +
           ", \"file\": " + Json(rule.file) + ", \"runs\": " + std::to_string(rule.runs) +
           ", \"fired\": " + std::to_string(rule.fired) + ", \"seconds\": " + Number(rule.seconds) +
           ", \"maxSeconds\": " + Number(rule.maxSeconds) + "}";
    separator = ",";
  }
  out += "\n  ],\n  \"actions\": {";
  separator = "";
  for (size_t code = 0; code < EngineStats::kActionCodes; ++code) {
    const ActionStats& action = Statistics().action(code);
    const uint64_t run = action.run.load(std::memory_order_relaxed);
    if (run == 0) continue;
    out += separator + std::string("\n    ") + Json(kActionNames[code]) +
           ": {\"run\": " + std::to_string(run) +
           ", \"failed\": " + std::to_string(action.failed.load(std::memory_order_relaxed)) + "}";
    separator = ",";
  }
  const Monitor::BackPressure pressure =
      monitor ? monitor->backPressure() : Monitor::BackPressure{};
  out += "\n  },\n  \"queue\": {\"depth\": " + std::to_string(engine.queue().pending()) +
         ", \"highWater\": " + std::to_string(engine.queue().highWater()) +
         "},\n  \"backPressure\": {\"pauses\": " + std::to_string(pressure.pauses) +
         ", \"seconds\": " + Number(pressure.seconds) + "}\n}\n";
  return out;
}

}  // namespace

std::string ControlAnswer(const std::string& request, const DaemonFigures& figures, Engine& engine,
                          const Monitor* monitor) {
  if (request == "stats") return Stats(figures, engine, monitor);
  if (request == "status") {
    char line[256];
    std::snprintf(line, sizeof line,
                  "running for %.0f s, %zu rules loaded, %" PRIu64 " events, %zu jobs queued\n",
                  MonotonicNow() - figures.startedAt, figures.rulesLoaded.load(),
                  Statistics().events(), engine.queue().pending());
    return line;
  }
  return "refused: unknown request (stats or status)";
}

}  // namespace tarvod
