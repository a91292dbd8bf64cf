#include "engine/dispatch.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "context/context.h"
#include "engine/event_record.h"
#include "engine/keyword_tables.h"
#include "engine/rule_processor.h"
#include "platform/diagnostic_log.h"

namespace tarvod {
namespace {

// Longer event types are malformed events: every prefix of a type is looked up and logged,
// so its size bounds the work one event can cause.
constexpr size_t kMaxEventTypeBytes = 1024;
constexpr size_t kMaxEventTypeComponents = 64;

// The prefixes of a type, longest first: "a.b.c", "a.b", "a", as views of the type itself.
// Empty components count, so "a..b" yields "a..b", "a.", "a".
std::vector<std::string_view> TypePrefixes(std::string_view type) {
  std::vector<std::string_view> prefixes{type};
  for (size_t dot = type.rfind('.'); dot != std::string_view::npos;
       dot = dot == 0 ? std::string_view::npos : type.rfind('.', dot - 1)) {
    prefixes.push_back(type.substr(0, dot));
  }
  return prefixes;
}

void QueuePrefix(std::string_view prefix, RulebaseEntry& entry,
                 const std::shared_ptr<const plist::Dictionary>& event, const RulebasePtr& rulebase,
                 const VariableStorePtr& variables) {
  LogMessage(2, "  Processing event: %.*s", static_cast<int>(prefix.size()), prefix.data());
  auto context = std::make_shared<Context>(variables, rulebase, *event);

  // The counter runs in the rulebase entry, so "prefix:eventCounter" counts the events of
  // this prefix since the rules were loaded (a reload starts a new rulebase at 0); the
  // context's copy is the count including this event.
  const uint64_t count = entry.eventCounter.fetch_add(1, std::memory_order_relaxed) + 1;
  const double now = CurrentTimeSince2001();
  entry.lastEventTimestamp.store(now, std::memory_order_relaxed);
  const std::string name(prefix);
  context->eventMetadata().set(name + ":eventCounter",
                               plist::Value::Integer(static_cast<int64_t>(count)));
  context->eventMetadata().set(name + ":lastEventTimestamp", plist::Value::Real(now));

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
  const std::string type = typeValue->textForm();
  const size_t components = std::count(type.begin(), type.end(), '.') + size_t{1};
  if (type.size() > kMaxEventTypeBytes || components > kMaxEventTypeComponents) {
    LogMessage(1,
               "DispatchEvent: dropping an event whose type has %zu bytes and %zu components "
               "(at most %zu and %zu)",
               type.size(), components, kMaxEventTypeBytes, kMaxEventTypeComponents);
    return;
  }
  LogEvent(event);
  LogMessage(1, "EVENT RECEIVED: %s", type.c_str());

  // One copy of the event, made when a prefix first has rules and shared by every record job
  // of this dispatch.
  std::shared_ptr<const plist::Dictionary> shared;
  for (const std::string_view prefix : TypePrefixes(type)) {
    auto found = rulebase ? rulebase->find(prefix) : Rulebase::iterator();
    if (rulebase && found != rulebase->end()) {
      if (!shared) shared = std::make_shared<const plist::Dictionary>(event);
      QueuePrefix(prefix, found->second, shared, rulebase, variables);
      continue;
    }
    if (prefix.size() == type.size()) WriteEventRecord(event, false, false);
    LogMessage(2, "  Dropping event %.*s because it has no associated rules",
               static_cast<int>(prefix.size()), prefix.data());
  }
}

void PostStartupEvent(const RulebasePtr& rulebase, const VariableStorePtr& variables, bool reload) {
  DispatchEvent(rulebase, DaemonEvent(reload ? "startup.reload" : "startup.load"), variables);
}

void PostShutdownEvent(const RulebasePtr& rulebase, const VariableStorePtr& variables) {
  DispatchEvent(rulebase, DaemonEvent("shutdown"), variables);
}

}  // namespace tarvod
