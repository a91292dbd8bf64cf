#include "tarvodctl_rules.h"

#include <unistd.h>

#include <cstdio>
#include <memory>
#include <optional>

#include "context/keychain.h"
#include "daemon/configuration.h"
#include "daemon/state.h"
#include "engine/engine.h"
#include "platform/clock.h"
#include "platform/diagnostic_log.h"
#include "plist/codec.h"

namespace {

using tarvod::Problem;

std::string JsonString(std::string_view text) {
  std::string out;
  plist::AppendEscapedString(out, text);  // its escapes are JSON's
  return out;
}

struct RulesOptions {
  std::string rulesPath = tarvod::kDefaultRulesPath;
  bool strict = false;
  bool json = false;
  std::vector<std::string> operands;
};

// -r RULES, --strict and --json anywhere among the words; false on a usage error.
bool ParseRulesOptions(const std::vector<std::string>& args, RulesOptions& options) {
  for (size_t i = 0; i < args.size(); ++i) {
    if (args[i] == "-r" && i + 1 < args.size()) {
      options.rulesPath = args[++i];
    } else if (args[i] == "--strict") {
      options.strict = true;
    } else if (args[i] == "--json") {
      options.json = true;
    } else if (args[i].starts_with("-") && args[i] != "--plist") {
      return false;
    } else {
      options.operands.push_back(args[i]);
    }
  }
  return true;
}

void PrintJson(const tarvod::LoadReport& report, size_t errors, size_t warnings) {
  std::printf(
      "{\"filesRead\": %zu, \"filesSkipped\": %zu, \"rulesLoaded\": %zu, "
      "\"errors\": %zu, \"warnings\": %zu, \"problems\": [",
      report.filesRead, report.filesSkipped, report.rulesLoaded, errors, warnings);
  const char* separator = "";
  for (const Problem& problem : report.problems) {
    std::printf(
        "%s\n  {\"severity\": \"%s\", \"file\": %s, \"rule\": %zu, \"name\": %s, "
        "\"key\": %s, \"message\": %s, \"text\": %s}",
        separator, problem.severity == Problem::Severity::kError ? "error" : "warning",
        JsonString(problem.file).c_str(), problem.rule, JsonString(problem.ruleName).c_str(),
        JsonString(problem.keyPath).c_str(), JsonString(problem.message).c_str(),
        JsonString(tarvod::FormatProblem(problem)).c_str());
    separator = ",";
  }
  std::printf("%s]}\n", report.problems.empty() ? "" : "\n");
}

// An engine with the configuration's initial globals and keychain store, as the daemon starts
// with them (the store is readable by root only; for others keychain references stay empty),
// and with restoreState the variables saved at the daemon's last stop (read, never written).
std::unique_ptr<tarvod::Engine> EngineAsTheDaemonHasIt(const std::string& configurationPath,
                                                       bool restoreState = false) {
  plist::Dictionary globals;
  plist::Dictionary configuration;
  tarvod::LoadConfiguration(configurationPath, &globals, &configuration);
  auto engine = std::make_unique<tarvod::Engine>(tarvod::Clock::System(), std::move(globals));
  engine->setKeychain(std::make_shared<tarvod::Keychain>(
      tarvod::ConfigurationString(configuration, "keychainPath", tarvod::kDefaultKeychainPath)));
  if (restoreState) tarvod::RestoreState(configuration, *engine, tarvod::Files::Real());
  return engine;
}

}  // namespace

int RunCheck(const std::vector<std::string>& args, const std::string& configurationPath) {
  RulesOptions options;
  if (!ParseRulesOptions(args, options) || !options.operands.empty()) return 2;

  tarvod::LoadReport report;
  tarvod::CheckConfiguration(configurationPath, report.problems);
  // The daemon's own loader, on an engine of its own: nothing running is touched.
  const std::unique_ptr<tarvod::Engine> engine = EngineAsTheDaemonHasIt(configurationPath);
  size_t count = 0;
  engine->loadRules(options.rulesPath, &count, &report);
  if (count == 0) {
    report.add(tarvod::FileProblem(options.rulesPath,
                                   "no rules loaded; the daemon would quit at startup"));
  }

  const size_t errors = report.count(Problem::Severity::kError);
  const size_t warnings = report.count(Problem::Severity::kWarning);
  if (options.json) {
    PrintJson(report, errors, warnings);
  } else {
    for (const Problem& problem : report.problems) {
      std::printf("%s\n", tarvod::FormatProblem(problem).c_str());
    }
    std::printf("%zu files read, %zu rules loaded, %zu files skipped, %zu errors, %zu warnings\n",
                report.filesRead, report.rulesLoaded, report.filesSkipped, errors, warnings);
  }
  return errors > 0 || (options.strict && warnings > 0) ? 1 : 0;
}

int RunTest(const std::vector<std::string>& args, const std::string& configurationPath) {
  RulesOptions options;
  if (!ParseRulesOptions(args, options) || options.strict || options.json) return 2;
  plist::Dictionary event;
  if (!options.operands.empty() && options.operands[0] == "--plist") {
    if (options.operands.size() != 2) return 2;
    const auto file = plist::ReadPropertyListFile(options.operands[1]);
    if (!file || !file->isDictionary()) {
      std::fprintf(stderr, "tarvodctl: %s is not a property-list dictionary\n",
                   options.operands[1].c_str());
      return 1;
    }
    event = file->dictionary();
  } else {
    if (options.operands.empty() || options.operands[0].find('=') != std::string::npos) return 2;
    plist::Dictionary details;
    for (size_t i = 1; i < options.operands.size(); ++i) {
      const std::string& pair = options.operands[i];
      const size_t equals = pair.find('=');
      if (equals == std::string::npos) return 2;
      details.set(pair.substr(0, equals), pair.substr(equals + 1));
    }
    event.set("eventType", options.operands[0]);
    event.set("eventDetails", std::move(details));
  }

  // The problems the rules run into (a substitution that fails, an unknown user) are the
  // daemon's level-0 messages: they go to standard error.
  tarvod::AttachErrorLog(dup(STDERR_FILENO));
  // The counters and marks rules keep are those the daemon saved, as after a restart.
  const std::unique_ptr<tarvod::Engine> enginePointer =
      EngineAsTheDaemonHasIt(configurationPath, true);
  tarvod::Engine& engine = *enginePointer;
  size_t count = 0;
  engine.swapRulebase(engine.loadRules(options.rulesPath, &count));
  if (count == 0) {
    std::fprintf(stderr, "tarvodctl: no rules loaded from %s\n", options.rulesPath.c_str());
    return 1;
  }
  const std::vector<std::string> lines = engine.dryRunEvent(event);
  if (lines.empty()) std::printf("no rules for this event type or its prefixes\n");
  for (const std::string& line : lines) std::printf("%s\n", line.c_str());
  tarvod::CloseLogs();
  return 0;
}
