#include "engine/dispatch.h"

#include <atomic>
#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "context/context.h"
#include "engine/event_record.h"
#include "engine/keyword_tables.h"
#include "engine/rule_processor.h"
#include "platform/diagnostic_log.h"

namespace tarvod {
namespace {

// The prefixes of a type, longest first: "a.b.c", "a.b", "a". Empty components count, so
// "a..b" yields "a..b", "a.", "a".
std::vector<std::string> TypePrefixes(const std::string& type) {
  std::vector<std::string> prefixes{type};
  for (size_t dot = type.rfind('.'); dot != std::string::npos;
       dot = dot == 0 ? std::string::npos : type.rfind('.', dot - 1)) {
    prefixes.push_back(type.substr(0, dot));
  }
  return prefixes;
}

void QueuePrefix(const std::string& prefix, RulebaseEntry& entry,
                 const std::shared_ptr<const plist::Dictionary>& event, const RulebasePtr& rulebase,
                 const VariableStorePtr& variables) {
  LogMessage(2, "  Processing event: %s", prefix.c_str());
  auto context = std::make_shared<Context>(variables, rulebase, *event);

  // The counter runs in the rulebase entry, so "prefix:eventCounter" counts the events of
  // this prefix since the rules were loaded (a reload starts a new rulebase at 0); the
  // context's copy is the count including this event.
  const uint64_t count = entry.eventCounter.fetch_add(1, std::memory_order_relaxed) + 1;
  const double now = CurrentTimeSince2001();
  entry.lastEventTimestamp.store(now, std::memory_order_relaxed);
  context->eventMetadata().set(prefix + ":eventCounter",
                               plist::Value::Integer(static_cast<int64_t>(count)));
  context->eventMetadata().set(prefix + ":lastEventTimestamp", plist::Value::Real(now));

  // The rules as they are now; each job holds its own reference to its rule.
  const std::vector<RulePtr> rules = entry.rules;
  auto fired = std::make_shared<std::atomic<bool>>(false);
  SerialQueue& queue = ProcessingQueue();
  for (const RulePtr& rule : rules) {
    queue.async([rule, context, fired] {
      if (ProcessRule(*rule, *context)) fired->store(true);
    });
  }
  // On the serial queue the record job runs after every rule job queued above, which is the
  // wait on the prefix's rule jobs.
  const bool hasRules = !rules.empty();
  queue.async(
      [event, fired, hasRules] { WriteEventRecord(*event, hasRules, hasRules && !fired->load()); });
}

plist::Dictionary DaemonEvent(const char* type) {
  return plist::Dictionary{
      {"eventType", plist::Value(type)},
      {"eventTimestamp", plist::Value::Real(CurrentTimeSince2001())},
      {"eventSource", plist::Value("tarvod")},
  };
}

}  // namespace

double CurrentTimeSince2001() {
  const auto sinceEpoch = std::chrono::system_clock::now().time_since_epoch();
  return std::chrono::duration<double>(sinceEpoch).count() - plist::kUnixTimeOfReferenceDate;
}

void DispatchEvent(const RulebasePtr& rulebase, const plist::Dictionary& event,
                   const VariableStorePtr& variables) {
  const plist::Value* typeValue = event.find("eventType");
  if (typeValue == nullptr) return;
  LogEvent(event);
  const std::string type = typeValue->textForm();
  LogMessage(1, "EVENT RECEIVED: %s", type.c_str());

  // One copy of the event, made when a prefix first has rules and shared by every record job
  // of this dispatch.
  std::shared_ptr<const plist::Dictionary> shared;
  for (const std::string& prefix : TypePrefixes(type)) {
    auto found = rulebase ? rulebase->find(prefix) : Rulebase::iterator();
    if (rulebase && found != rulebase->end()) {
      if (!shared) shared = std::make_shared<const plist::Dictionary>(event);
      QueuePrefix(prefix, found->second, shared, rulebase, variables);
      continue;
    }
    if (prefix.size() == type.size()) WriteEventRecord(event, false, false);
    LogMessage(2, "  Dropping event %s because it has no associated rules", prefix.c_str());
  }
}

void PostStartupEvent(const RulebasePtr& rulebase, const VariableStorePtr& variables, bool reload) {
  DispatchEvent(rulebase, DaemonEvent(reload ? "startup.reload" : "startup.load"), variables);
}

void PostShutdownEvent(const RulebasePtr& rulebase, const VariableStorePtr& variables) {
  DispatchEvent(rulebase, DaemonEvent("shutdown"), variables);
}

}  // namespace tarvod
