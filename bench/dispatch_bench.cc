// Events through the rule engine in process (no socket): dispatch, a rule with two criteria
// and a file log action, and the event's record; the same with the error log's repeat limit
// checking a line per event, and the check alone; and the cost of one event record alone.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "actions/log_action.h"
#include "engine/engine.h"
#include "engine/event_record.h"
#include "engine/keyword_tables.h"
#include "platform/clock.h"
#include "platform/diagnostic_log.h"
#include "platform/repeat_limiter.h"
#include "platform/structured_log.h"

namespace tarvod {
namespace {

using plist::Array;
using plist::Dictionary;
using plist::Value;

std::string BenchDirectory() {
  static const std::string dir = [] {
    char pattern[] = "/tmp/tarvod-bench-XXXXXX";
    return std::string(mkdtemp(pattern) ? pattern : "/tmp");
  }();
  return dir;
}

Dictionary AuthFailure() {
  return Dictionary{
      {"eventType", "auth.failure"},
      {"eventSource", "Auditpipe"},
      {"eventTimestamp", Value::Real(7.5e8)},
      {"eventDetails", Dictionary{{"clientIP", "192.0.2.7"},
                                  {"message", "authentication failure"},
                                  {"protocolName", "SSH"},
                                  {"username", "admin"}}},
  };
}

// A rulebase with one rule on "auth.failure": two criteria, then a file log action and any
// further actions.
RulebasePtr AuthRulebase(const std::string& dir, Array moreActions = {}) {
  Array actions{
      Value(Dictionary{{"type", "log"},
                       {"message", "failed login for ${event:username} from ${event:clientIP}"},
                       {"logPath", dir + "/auth.log"}})};
  for (Value& action : moreActions) actions.push_back(std::move(action));
  auto rulebase = std::make_shared<Rulebase>();
  (*rulebase)["auth.failure"].rules = {std::make_shared<const Rule>(Dictionary{
      {"name", "failed login"},
      {"filePath", "/etc/tarvod.d/rules/auth.plist"},
      {"criterion",
       Array{Value(Dictionary{{"operator", "equal"},
                              {"operands", Array{Value("${event:protocolName}"), Value("SSH")}}}),
             Value(Dictionary{{"operator", "beginswith"},
                              {"operands", Array{Value("${event:clientIP}"), Value("192.")}}})}},
      {"actions", std::move(actions)},
  })};
  return rulebase;
}

void BM_DispatchThroughRuleWithFileLog(benchmark::State& state) {
  BuildKeywordTables();
  BuildLevelNameTable();
  const std::string dir = BenchDirectory();
  ConfigureStructuredLog(dir + "/records.jsonl");
  Engine engine(Clock::System(), Dictionary{});
  engine.swapRulebase(AuthRulebase(dir));
  const Dictionary event = AuthFailure();
  for (auto _ : state) {
    engine.dispatchEvent(event);
    engine.queue().waitUntilPendingAtMost(256);
  }
  engine.queue().drain();
  state.SetItemsProcessed(state.iterations());
  std::filesystem::remove(dir + "/auth.log");
  std::filesystem::remove(dir + "/records.jsonl");
}
BENCHMARK(BM_DispatchThroughRuleWithFileLog)->UseRealTime();

// The cost of the error log's repeat limit, end to end: the dispatch above with an error log
// attached and a second log action whose file cannot be opened, named after the event's
// serial number, so that each event writes one level-0 line of a text never seen before.
// Every line is checked and none is held back (the worst case: each one a new key, the table
// full and its oldest entry dropped), so the difference between the limit off (argument 0)
// and on (10 s) is the check alone.
void BM_DispatchWritingDistinctFailures(benchmark::State& state) {
  BuildKeywordTables();
  BuildLevelNameTable();
  const std::string dir = BenchDirectory();
  ConfigureStructuredLog(dir + "/records.jsonl");
  AttachErrorLog(SafeOpen((dir + "/error.log").c_str(), 0600, O_WRONLY | O_APPEND));
  SetLogRepeatInterval(static_cast<double>(state.range(0)));
  Engine engine(Clock::System(), Dictionary{});
  engine.swapRulebase(AuthRulebase(
      dir,
      Array{Value(Dictionary{
          {"type", "log"}, {"message", "lost"}, {"logPath", dir + "/missing/${event:serial}"}})}));
  Dictionary event = AuthFailure();
  int64_t serial = 0;
  for (auto _ : state) {
    event.set("serial", Value(std::to_string(++serial)));
    engine.dispatchEvent(event);
    engine.queue().waitUntilPendingAtMost(256);
  }
  engine.queue().drain();
  CloseLogs();
  SetLogRepeatInterval(kDefaultLogRepeatInterval);
  state.SetItemsProcessed(state.iterations());
  std::filesystem::remove(dir + "/auth.log");
  std::filesystem::remove(dir + "/error.log");
  std::filesystem::remove(dir + "/records.jsonl");
}
BENCHMARK(BM_DispatchWritingDistinctFailures)->Arg(0)->Arg(10)->UseRealTime();

// The check alone, per line, as the error log runs it under its lock: a text never seen before
// (argument 0: a new entry, the table full, its oldest entry dropped) or one repeated
// (argument 1: counted).
void BM_RepeatCheckPerLine(benchmark::State& state) {
  RepeatLimiter limiter(Clock::System(), kDefaultLogRepeatInterval);
  std::vector<std::string> summaries;
  const std::string prefix = "LOG: Cannot open /var/log/app/missing/";
  std::string text = prefix + "0 errno = 2";
  int64_t serial = 0;
  for (auto _ : state) {
    if (state.range(0) == 0) {
      text.resize(prefix.size());
      text += std::to_string(++serial);
      text += " errno = 2";
    }
    benchmark::DoNotOptimize(limiter.admit(text, summaries));
    summaries.clear();
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_RepeatCheckPerLine)->Arg(0)->Arg(1);

void BM_EventRecordJsonLines(benchmark::State& state) {
  const std::string path = BenchDirectory() + "/records.jsonl";
  ConfigureStructuredLog(path);
  const Dictionary event = AuthFailure();
  for (auto _ : state) WriteEventRecord(event, true, false);
  state.SetItemsProcessed(state.iterations());
  std::filesystem::remove(path);
}
BENCHMARK(BM_EventRecordJsonLines);

void BM_EventRecordJournal(benchmark::State& state) {
  if (access("/run/systemd/journal/socket", F_OK) != 0) {
    state.SkipWithError("no journald on this host");
    return;
  }
  ConfigureStructuredLog("");
  const Dictionary event = AuthFailure();
  for (auto _ : state) WriteEventRecord(event, true, false);
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_EventRecordJournal);

}  // namespace
}  // namespace tarvod
