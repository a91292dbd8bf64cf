// Cost of the context's three everyday operations: one lookup, the substitution of a typical
// alert message, and an assignment whose value goes through the arithmetic rule.
#include <benchmark/benchmark.h>

#include "context/context.h"

namespace tarvod {
namespace {

const std::string kRulesFile = "/etc/tarvod.d/rules/bench.plist";

VariableStorePtr MakeStore() {
  auto store = std::make_shared<VariableStore>();
  store->set(kGlobalsKey, plist::Dictionary{{"admin", "root@example.com"}});
  store->set(kRulesFile, plist::Dictionary{{"threshold", plist::Value::Integer(3)},
                                           {"failures", plist::Value::Integer(5)},
                                           {"site", "north"}});
  return store;
}

const plist::Dictionary kEvent{
    {"eventType", "auth.failure"},
    {"eventDetails", plist::Dictionary{{"username", "alice"}, {"clientIP", "192.0.2.17"}}}};

void BM_Lookup(benchmark::State& state) {
  Context context(MakeStore(), std::make_shared<Rulebase>(), kEvent);
  for (auto _ : state) {
    benchmark::DoNotOptimize(context.variableValueForKey("threshold", kRulesFile));
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_Lookup);

void BM_SubstituteMessage(benchmark::State& state) {
  Context context(MakeStore(), std::make_shared<Rulebase>(), kEvent);
  // About 200 bytes with four references from three namespaces.
  const std::string message =
      "Security notice for site ${site}: the account ${event:username} failed to log in from "
      "${event:clientIP} more often than allowed. Please review the host's recent activity and "
      "reply to ${global:admin} today.";
  for (auto _ : state) {
    ErrorSlot error;
    benchmark::DoNotOptimize(context.resolveVariablesInString(message, kRulesFile, &error));
  }
  state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(message.size()));
}
BENCHMARK(BM_SubstituteMessage);

void BM_AssignArithmetic(benchmark::State& state) {
  Context context(MakeStore(), std::make_shared<Rulebase>(), kEvent);
  const plist::Value value("${failures} * 2 + ${threshold}");
  for (auto _ : state) {
    context.setVariableValue(value, "score", kRulesFile);
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_AssignArithmetic);

}  // namespace
}  // namespace tarvod
