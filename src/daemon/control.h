// The answers of the daemon's control socket: "stats" (JSON: uptime, rules loaded and the
// last reload, events per type prefix, rules run and fired with their time, actions run and
// failed per type, the processing queue and back-pressure) and "status" (one line). Any
// thread: everything read is atomic or locked.
#pragma once

#include <atomic>
#include <string>

#include "engine/engine.h"
#include "sources/monitor.h"

namespace tarvod {

struct DaemonFigures {
  double startedAt = 0;                // monotonic seconds
  std::atomic<size_t> rulesLoaded{0};  // by the last load
  std::atomic<double> lastReload{0};   // seconds since 2001; 0: never reloaded
};

std::string ControlAnswer(const std::string& request, const DaemonFigures& figures, Engine& engine,
                          const Monitor* monitor);

}  // namespace tarvod
