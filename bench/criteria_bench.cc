// Cost of evaluating a rule's two criteria against one event's context.
#include <benchmark/benchmark.h>

#include "engine/keyword_tables.h"
#include "engine/rule_processor.h"

namespace tarvod {
namespace {

void BM_TwoCriteria(benchmark::State& state) {
  BuildKeywordTables();
  const std::string rulesFile = "/etc/tarvod.d/rules/bench.plist";
  auto store = std::make_shared<VariableStore>();
  store->set(kGlobalsKey, plist::Dictionary{});
  store->set(rulesFile, plist::Dictionary{{"threshold", plist::Value::Integer(3)}});
  const plist::Dictionary event{
      {"eventType", "auth.failure"},
      {"eventDetails",
       plist::Dictionary{{"username", "alice"}, {"failures", plist::Value::Integer(5)}}}};
  Context context(store, std::make_shared<Rulebase>(), event);
  const Rule rule{{"filePath", rulesFile}};
  const plist::Dictionary first{
      {"operator", "beginswith"},
      {"operands", plist::Value(plist::Array{"${event:eventType}", "auth."})}};
  const plist::Dictionary second{
      {"operator", "greaterthan"},
      {"operands", plist::Value(plist::Array{"${event:failures}", "${threshold}"})}};
  for (auto _ : state) {
    const bool passed =
        ProcessCriteria(first, rule, context) && ProcessCriteria(second, rule, context);
    benchmark::DoNotOptimize(passed);
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_TwoCriteria);

}  // namespace
}  // namespace tarvod
