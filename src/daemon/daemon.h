// The daemon: startup from the command line and configuration, the main loop in 5-second
// slices, reload on SIGHUP and the orderly stop. It owns the configuration, the Engine and
// the Monitor. Main thread only.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "daemon/control.h"
#include "engine/engine.h"
#include "platform/clock.h"
#include "platform/control_socket.h"
#include "platform/files.h"
#include "platform/main_loop.h"
#include "platform/notification_center.h"
#include "plist/value.h"
#include "sources/monitor.h"
#include "sources/periodic_events.h"

namespace tarvod {

class Daemon {
 public:
  Daemon(const Clock& clock, Files& files);
  ~Daemon();
  Daemon(const Daemon&) = delete;
  Daemon& operator=(const Daemon&) = delete;

  // Everything up to the main loop. nullopt: the daemon runs; otherwise the exit status
  // (255 for a usage error or logs that cannot be opened, 0 when no rules were found).
  std::optional<int> startup(int argc, char** argv);
  // Slices until a stop is requested, reloading when asked.
  void runMainLoop();
  // SIGHUP: a new rulebase, swapped in while the sources keep delivering.
  void ReloadRules();
  // The shutdown event, the sources stopped, the queue drained within shutdownTimeout, the
  // state saved, the logs closed. The last thing the daemon does.
  void Shutdown();

 private:
  // `tarvodctl stats` and `status`; a failure is logged and the daemon runs on.
  void StartControlSocket();

  const Clock& mClock;
  Files& mFiles;
  std::string mConfigurationPath;
  plist::Dictionary mConfiguration;
  std::string mRulesPath;
  std::unique_ptr<Engine> mEngine;
  std::unique_ptr<Monitor> mMonitor;
  NotificationCenter& mCenter = NotificationCenter::Default();
  std::unique_ptr<MainLoop> mMainLoop;
  RunningTimers mRunningTimers;
  DaemonFigures mFigures;
  std::unique_ptr<ControlSocket> mControl;  // stopped before the Monitor and the Engine
};

// main: the process exit status.
int DaemonMain(int argc, char** argv);

}  // namespace tarvod
