// Events through the rule engine in process (no socket): dispatch, a rule with two criteria
// and a file log action, and the event's record; and the cost of one event record alone.
#include <benchmark/benchmark.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <string>

#include "actions/log_action.h"
#include "engine/engine.h"
#include "engine/event_record.h"
#include "engine/keyword_tables.h"
#include "platform/diagnostic_log.h"
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

void BM_DispatchThroughRuleWithFileLog(benchmark::State& state) {
  BuildKeywordTables();
  BuildLevelNameTable();
  const std::string dir = BenchDirectory();
  ConfigureStructuredLog(dir + "/records.jsonl");
  Engine engine(Clock::System(), Dictionary{});
  auto rulebase = std::make_shared<Rulebase>();
  (*rulebase)["auth.failure"].rules = {std::make_shared<const Rule>(Dictionary{
      {"name", "failed login"},
      {"filePath", "/etc/tarvod.d/rules/auth.plist"},
      {"criterion",
       Array{Value(Dictionary{{"operator", "equal"},
                              {"operands", Array{Value("${event:protocolName}"), Value("SSH")}}}),
             Value(Dictionary{{"operator", "beginswith"},
                              {"operands", Array{Value("${event:clientIP}"), Value("192.")}}})}},
      {"actions", Array{Value(Dictionary{
                      {"type", "log"},
                      {"message", "failed login for ${event:username} from ${event:clientIP}"},
                      {"logPath", dir + "/auth.log"}})}},
  })};
  engine.swapRulebase(rulebase);
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
