#include "daemon/daemon.h"

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "actions/log_action.h"
#include "context/keychain.h"
#include "daemon/companion_job.h"
#include "daemon/configuration.h"
#include "daemon/logs.h"
#include "daemon/options.h"
#include "daemon/signals.h"
#include "daemon/state.h"
#include "engine/rule_processor.h"
#include "platform/diagnostic_log.h"
#include "platform/host_stats.h"
#include "platform/main_loop.h"
#include "platform/structured_log.h"
#include "sources/event_listener.h"
#include "sources/monitor_engine.h"
#include "sources/notifications.h"

namespace tarvod {
namespace {

constexpr uint64_t kSliceMicroseconds = 5'000'000;
constexpr int64_t kDefaultShutdownTimeout = 10;

// The audit session of this process, as the security-session message reports it.
void LogSecuritySession() {
  long session = -1;
  int status = 0;
  if (FILE* file = std::fopen("/proc/self/sessionid", "re")) {
    if (std::fscanf(file, "%ld", &session) != 1) {
      session = -1;
      status = EINVAL;
    }
    std::fclose(file);
  } else {
    status = errno;
  }
  LogMessage(4, "Velkin security session id = %x (%d)", static_cast<unsigned>(session), status);
}

// Each problem of the configuration and the rules at level 1, then one summary line at level 0,
// so that the service's log shows a wrong rule without raising the debug level.
RulebasePtr LoadRulesReporting(Engine& engine, const std::string& configurationPath,
                               const std::string& rulesPath, size_t* count) {
  LoadReport report;
  CheckConfiguration(configurationPath, report.problems);
  RulebasePtr rulebase = engine.loadRules(rulesPath, count, &report);
  for (const Problem& problem : report.problems) {
    LogMessage(1, "%s", FormatProblem(problem).c_str());
  }
  // At the default debug level the problems themselves are not written: say where to see them.
  const bool hidden = !report.problems.empty() && DebugLevel() < 1;
  LogMessage(0,
             "Rules from %s: %zu files read, %zu rules loaded, %zu files skipped, %zu problems "
             "found%s",
             rulesPath.c_str(), report.filesRead, report.rulesLoaded, report.filesSkipped,
             report.problems.size(), hidden ? " (tarvodctl check lists them)" : "");
  return rulebase;
}

std::optional<IdSet> FilterList(const plist::Dictionary& configuration, const char* key) {
  const plist::Value* value = configuration.find(key);
  return ParseFilterList(value ? std::optional<std::string>(value->textForm()) : std::nullopt);
}

}  // namespace

Daemon::Daemon(const Clock& clock, Files& files) : mClock(clock), mFiles(files) {}

Daemon::~Daemon() {
  // The sources go first: they dispatch into the engine until their thread is joined.
  mControl.reset();
  mRunningTimers.clear();
  mMonitor.reset();
  mEngine.reset();
}

std::optional<int> Daemon::startup(int argc, char** argv) {
  plist::Dictionary globals;
  if (argc == 2 && std::strcmp(argv[1], "--version") == 0) {
    std::printf("tarvod %s\n", TARVOD_VERSION);
    return 0;
  }
  InstallSignalHandlers();
  const std::optional<Options> options = ParseOptions(argc, argv);
  if (!options) {
    std::fprintf(stderr,
                 "Usage: %s [ -r <rules.plist>] [-c <config file> ] [-v <debug level>] [-n]\n",
                 argv[0]);
    return 255;
  }

  mConfigurationPath = options->configurationPath;
  mConfiguration = plist::Dictionary{{"rulesPath", plist::Value(kDefaultRulesPath)}};
  LoadConfiguration(mConfigurationPath, &globals, &mConfiguration);
  if (SetUpLogs(mConfiguration) != 0) {
    CloseLogs();
    return 255;
  }
  if (options->debugLevel != 0) {
    SetDebugLevel(options->debugLevel);
  } else if (mConfiguration.contains("debugLevel")) {
    SetDebugLevel(ConfigurationInteger(mConfiguration, "debugLevel"));
  }
  LogMessage(0, "Velkin Started %s", LocalDateText(mClock).c_str());

  mEngine = std::make_unique<Engine>(mClock, std::move(globals));
  mEngine->setKeychain(std::make_shared<Keychain>(
      ConfigurationString(mConfiguration, "keychainPath", kDefaultKeychainPath)));
  if (options->restoreState) {
    LogMessage(1, "Restoring saved state");
    RestoreState(mConfiguration, *mEngine, mFiles);
  }
  LogSecuritySession();

  mRulesPath = options->rulesPath.value_or(kDefaultRulesPath);
  LogMessage(4, "Velkin rules path is %s", mRulesPath.c_str());
  mConfiguration.set("rulesPath", plist::Value(mRulesPath));
  BuildLevelNameTable();
  SetKeepLogFilesOpen(ConfigurationInteger(mConfiguration, "keepLogFilesOpen") != 0);
  SetDefaultCommandTimeout(static_cast<double>(
      std::max<int64_t>(0, ConfigurationInteger(mConfiguration, "commandTimeout"))));
  SetMailPrograms(
      ConfigurationString(mConfiguration, "mailProgram", "/usr/bin/mail"),
      ConfigurationString(mConfiguration, "relayMailProgram", "/usr/libexec/tarvod/femail"));
  InitHostStats();
  ConfigureStructuredLog(ConfigurationString(mConfiguration, "structuredLogPath", ""));
  if (!DefaultStructuredLog().canDeliver()) {
    LogMessage(0,
               "Event records have nowhere to go: no journal socket (journald is not running) and "
               "no structuredLogPath; start systemd-journald or set structuredLogPath to a file");
  }

  size_t ruleCount = 0;
  mEngine->swapRulebase(LoadRulesReporting(*mEngine, mConfigurationPath, mRulesPath, &ruleCount));
  LogMessage(1, "Loaded %zu rules\n", ruleCount);
  mFigures.rulesLoaded = ruleCount;
  if (ruleCount == 0) {
    LogMessage(0, "No rules found in %s, quitting....", mRulesPath.c_str());
    LogMessage(0, "Velkin Shutdown at %s", LocalDateText(mClock).c_str());
    CloseLogs();
    return 0;
  }

  mMonitor = std::make_unique<Monitor>(EngineHooks(*mEngine));
  mMonitor->setEventSocketPath(
      ConfigurationString(mConfiguration, "eventSocketPath", kDefaultEventSocketPath));
  const std::string authLogSource = ConfigurationString(mConfiguration, "authLogSource", "journal");
  const std::string stateDirectory =
      ConfigurationString(mConfiguration, "stateDirectory", kDefaultStateDirectory);
  // The journal cursor lives beside the saved state, so that a restart resumes where it was.
  if (authLogSource == "journal") mFiles.makeDirectories(stateDirectory, 0700);
  mMonitor->setAuthLogSource(authLogSource, stateDirectory + "/journal_cursor");
  mMonitor->setConnectionIdleTimeout(
      ConfigurationInteger(mConfiguration, "connectionIdleTimeout", kDefaultConnectionIdleTimeout));
  mMonitor->setMaxConnectionsPerUID(
      ConfigurationInteger(mConfiguration, "maxConnectionsPerUID", kDefaultMaxConnectionsPerUID));
  mMonitor->setEventFilterUID(FilterList(mConfiguration, "filterByUID"),
                              FilterList(mConfiguration, "filterByGID"));
  mEngine->postStartupEvent(false);
  mMainLoop = std::make_unique<MainLoop>();
  mRunningTimers = CreatePeriodicEvents(mConfiguration, *mMonitor, *mMainLoop, mClock);
  if (const Status attached = mCenter.attach(*mMainLoop); !attached.ok()) {
    LogMessage(0, "Notifications are neither observed nor posted: %s", attached.what().c_str());
  }
  const int registered = RegisterNotifications(mCenter, *mEngine->rulebase(), *mMonitor);
  mMonitor->beginListening();
  StartControlSocket();
  LogMessage(1, "Registered %d events", registered);
  EnableCompanionLogJob();
  NotifyServiceManager("READY=1");
  return std::nullopt;
}

void Daemon::StartControlSocket() {
  mFigures.startedAt = mClock.monotonic();
  const std::string path = ControlSocketPath(
      ConfigurationString(mConfiguration, "eventSocketPath", kDefaultEventSocketPath));
  std::string error;
  mControl = ControlSocket::Start(
      path,
      [this](const std::string& request) {
        return ControlAnswer(request, mFigures, *mEngine, mMonitor.get());
      },
      &error);
  if (!mControl) LogMessage(0, "The control socket is not available: %s", error.c_str());
}

void Daemon::runMainLoop() {
  mMainLoop->watch(SignalWakeDescriptor(), ClearSignalWake);
  for (;;) {
    const bool canRun = mMainLoop->runSlice(kSliceMicroseconds);
    if (TakeStopRequest()) return;
    if (TakeReloadRequest()) {
      ReloadRules();
      // Only the file's initialGlobals are read again: they reset the globals they name.
      plist::Dictionary initialGlobals;
      LoadConfiguration(mConfigurationPath, &initialGlobals, nullptr);
      mEngine->withVariables([&](VariableStore& store) {
        plist::Value* globals = store.find(kGlobalsKey);
        if (globals == nullptr || !globals->isDictionary()) {
          store.set(kGlobalsKey, plist::Value(plist::Dictionary()));
          globals = store.find(kGlobalsKey);
        }
        for (auto& [key, value] : initialGlobals) globals->dictionary().set(key, value);
      });
      NotifyServiceManager("READY=1");
    }
    if (!canRun) return;
  }
}

void Daemon::ReloadRules() {
  NotifyServiceManager("RELOADING=1");
  // logrotate moves the logs away and asks for a reload: from here on they are new files.
  ReopenLogs(mConfiguration);
  LogMessage(1, "Reloading Rules");
  // Notifications posted from here on are held and delivered to the new observations.
  mCenter.suspend();
  // New connections wait in the listen backlog; accepted ones and the audit source go on
  // delivering, against the old rulebase until the swap and the new one after it.
  mMonitor->suspend();
  CancelPeriodicEvents(mRunningTimers);
  UnregisterNotifications(mCenter, *mEngine->rulebase(), *mMonitor);
  size_t ruleCount = 0;
  RulebasePtr rulebase = LoadRulesReporting(*mEngine, mConfigurationPath, mRulesPath, &ruleCount);
  LogMessage(1, "Loaded %zu rules\n", ruleCount);
  mFigures.rulesLoaded = ruleCount;
  mFigures.lastReload = mClock.now();
  mEngine->swapRulebase(std::move(rulebase));
  ReopenKeptLogFiles();
  mEngine->postStartupEvent(true);
  mRunningTimers = CreatePeriodicEvents(mConfiguration, *mMonitor, *mMainLoop, mClock);
  mMonitor->resume();
  RegisterNotifications(mCenter, *mEngine->rulebase(), *mMonitor);
  mCenter.resume();
}

void Daemon::Shutdown() {
  NotifyServiceManager("STOPPING=1");
  CancelPeriodicEvents(mRunningTimers);
  mEngine->postShutdownEvent();
  UnregisterNotifications(mCenter, *mEngine->rulebase(), *mMonitor);
  mControl.reset();
  mMonitor->stopListening();
  mEngine->closeDispatch();

  // A rule blocked for good (a FIFO nobody reads, a child that never exits) must not keep
  // the daemon from stopping: after the timeout what is left is reported and dropped.
  int64_t timeout = kDefaultShutdownTimeout;
  if (mConfiguration.contains("shutdownTimeout")) {
    timeout = std::max<int64_t>(0, ConfigurationInteger(mConfiguration, "shutdownTimeout"));
  }
  if (const size_t pending = mEngine->drain(static_cast<double>(timeout))) {
    LogMessage(0, "Shutdown: %zu rule jobs still pending after %lld seconds; stopping without them",
               pending, static_cast<long long>(timeout));
  }

  // What the last rules posted leaves before the daemon does.
  mCenter.flush(1.0);

  LogMessage(1, "Saving the global state...");
  SaveState(mConfiguration, *mEngine, mFiles);
  LogMessage(0, "Velkin Shutdown at %s", LocalDateText(mClock).c_str());
  CloseLogs();
}

int DaemonMain(int argc, char** argv) {
  Daemon daemon(Clock::System(), Files::Real());
  if (std::optional<int> status = daemon.startup(argc, argv)) return *status;
  daemon.runMainLoop();
  daemon.Shutdown();
  return 0;
}

}  // namespace tarvod
