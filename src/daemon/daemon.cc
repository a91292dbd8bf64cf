#include "daemon/daemon.h"

#include <systemd/sd-event.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>

#include "actions/log_action.h"
#include "context/types.h"
#include "daemon/configuration.h"
#include "daemon/logs.h"
#include "daemon/signals.h"
#include "engine/dispatch.h"
#include "engine/keyword_tables.h"
#include "engine/rules_loader.h"
#include "platform/diagnostic_log.h"
#include "platform/host_stats.h"
#include "platform/structured_log.h"
#include "plist/value.h"
#include "sources/event_listener.h"
#include "sources/monitor.h"

namespace tarvod {
namespace {

constexpr uint64_t kSliceMicroseconds = 5'000'000;

struct Options {
  std::string configurationPath = kDefaultConfigurationPath;
  std::string rulesPath;  // empty: the default
  int64_t debugLevel = 0;
  bool restoreState = true;
};

// Parses "r:c:nv:"; false on an unknown letter or a missing argument.
bool ParseOptions(int argc, char** argv, Options& options) {
  opterr = 0;  // the usage line is the only text a bad command line produces
  int letter;
  while ((letter = getopt(argc, argv, "r:c:nv:")) != -1) {
    switch (letter) {
      case 'r':
        options.rulesPath = optarg;
        break;
      case 'c':
        options.configurationPath = optarg;
        break;
      case 'n':
        options.restoreState = false;
        break;
      case 'v':
        options.debugLevel = plist::LeadingInteger(optarg);
        break;
      default:
        return false;
    }
  }
  return true;
}

std::string NowText() {
  return plist::FormatDate(plist::Date{static_cast<double>(time(nullptr)) -
                                       plist::kUnixTimeOfReferenceDate},
                           true);
}

// The extension of the path's last component ("rules.plist" -> "plist", "rules/" -> "").
std::string PathExtension(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  const std::string name = std::filesystem::path(path).filename().string();
  const size_t dot = name.rfind('.');
  if (dot == std::string::npos || dot == 0 || dot + 1 == name.size()) return "";
  return name.substr(dot + 1);
}

size_t LoadRules(const RulebasePtr& rulebase, const VariableStorePtr& variables,
                 const std::string& rulesPath) {
  if (!PathExtension(rulesPath).empty()) return LoadRulesFile(rulebase, variables, rulesPath);
  return LoadRulesDirectory(rulebase, variables, rulesPath);
}

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

int OnSignalWake(sd_event_source*, int, uint32_t, void*) {
  ClearSignalWake();
  return 0;
}

}  // namespace

int DaemonMain(int argc, char** argv) {
  // Step 1: the empty globals.
  plist::Dictionary globals;

  // Steps 2 and 3: signals, then the command line.
  InstallSignalHandlers();
  Options options;
  if (!ParseOptions(argc, argv, options)) {
    std::fprintf(stderr, "Usage: %s [ -r <rules.plist>] [-c <config file> ] [-v <debug level>] [-n]\n",
                 argv[0]);
    return 255;
  }

  // Step 4: configuration, seeded with the default rules path.
  plist::Dictionary configuration{{"rulesPath", plist::Value(kDefaultRulesPath)}};
  LoadConfiguration(options.configurationPath, &globals, &configuration);

  // Step 5: logs.
  if (SetUpLogs(configuration) != 0) {
    CloseLogs();
    return 255;
  }

  // Step 6: debug level.
  if (options.debugLevel != 0) {
    SetDebugLevel(options.debugLevel);
  } else if (configuration.contains("debugLevel")) {
    SetDebugLevel(ConfigurationInteger(configuration, "debugLevel"));
  }

  LogMessage(0, "Velkin Started %s", NowText().c_str());

  // Step 8: the variable store.
  auto variables = std::make_shared<VariableStore>();
  variables->set(kGlobalsKey, plist::Value(std::move(globals)));

  // Step 9: saved state.
  if (options.restoreState) {
    LogMessage(1, "Restoring saved state");
  }

  LogSecuritySession();

  // Step 11: rules path.
  const std::string rulesPath = options.rulesPath.empty() ? kDefaultRulesPath : options.rulesPath;
  LogMessage(4, "Velkin rules path is %s", rulesPath.c_str());
  configuration.set("rulesPath", plist::Value(rulesPath));

  BuildKeywordTables();
  BuildLevelNameTable();
  InitHostStats();
  ConfigureStructuredLog(ConfigurationString(configuration, "structuredLogPath", ""));

  // Steps 15 to 18: the rules.
  auto rulebase = std::make_shared<Rulebase>();
  const size_t ruleCount = LoadRules(rulebase, variables, rulesPath);
  LogMessage(1, "Loaded %zu rules\n", ruleCount);
  if (ruleCount == 0) {
    LogMessage(0, "No rules found in %s, quitting....", rulesPath.c_str());
    LogMessage(0, "Velkin Shutdown at %s", NowText().c_str());
    CloseLogs();
    return 0;
  }

  // Step 19: Monitor.
  auto monitor = std::make_unique<Monitor>(rulebase, variables);
  monitor->setEventSocketPath(
      ConfigurationString(configuration, "eventSocketPath", kDefaultEventSocketPath));
  monitor->setConnectionIdleTimeout(
      ConfigurationInteger(configuration, "connectionIdleTimeout", kDefaultConnectionIdleTimeout));
  monitor->setMaxConnectionsPerUID(
      ConfigurationInteger(configuration, "maxConnectionsPerUID", kDefaultMaxConnectionsPerUID));
  // Step 20: sender filter.
  const auto filterText = [&](const char* key) -> std::optional<std::string> {
    const plist::Value* value = configuration.find(key);
    return value ? std::optional<std::string>(value->textForm()) : std::nullopt;
  };
  monitor->setEventFilterUID(ParseFilterList(filterText("filterByUID")),
                             ParseFilterList(filterText("filterByGID")));
  PostStartupEvent(rulebase, variables, false);
  // Step 22: periodic events.
  // Step 23: notification observers.
  // Step 24: begin listening.
  monitor->beginListening();
  LogMessage(1, "Registered %d events", 0);
  // Step 26: enable the companion log job.

  // The main loop: one sd_event_run of at most five seconds per slice, then the requests.
  sd_event* loop = nullptr;
  sd_event_default(&loop);
  sd_event_source* wakeSource = nullptr;
  if (loop) {
    sd_event_add_io(loop, &wakeSource, SignalWakeDescriptor(), EPOLLIN, OnSignalWake, nullptr);
  }
  for (;;) {
    if (loop) {
      sd_event_run(loop, kSliceMicroseconds);
    } else {
      usleep(kSliceMicroseconds);  // no loop could be made: still honour requests per slice
    }
    if (TakeStopRequest()) break;
    if (TakeReloadRequest()) {
      // Reload rules.
    }
  }

  PostShutdownEvent(rulebase, variables);
  // Stop the sources.
  monitor->stopListening();
  // The shutdown rules, and those of every event the sources had already read, run before
  // the logs close.
  ProcessingQueue().drain();
  LogMessage(0, "Velkin Shutdown at %s", NowText().c_str());
  CloseLogs();
  // Connections accepted earlier may still deliver until the input thread is gone; after it
  // is joined and the last jobs have run, nothing else touches the daemon's objects at exit.
  monitor.reset();
  ProcessingQueue().drain();
  sd_event_source_unref(wakeSource);
  sd_event_unref(loop);
  return 0;
}

}  // namespace tarvod
