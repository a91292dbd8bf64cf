#include "engine/engine.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "actions/log_action.h"
#include "context/context.h"
#include "engine/event_record.h"
#include "engine/keyword_tables.h"
#include "engine/rule_processor.h"
#include "engine/rules_loader.h"
#include "engine/stats.h"
#include "platform/diagnostic_log.h"
#include "platform/structured_log.h"

namespace tarvod {
namespace {

// Longer event types are malformed events: every prefix of a type is looked up and logged,
// so its size bounds the work one event can cause.
constexpr size_t kMaxEventTypeBytes = 1024;
constexpr size_t kMaxEventTypeComponents = 64;

// Calls visit with each prefix of a type, longest first: "a.b.c", "a.b", "a", as views of the
// type itself. Empty components count, so "a..b" yields "a..b", "a.", "a".
template <typename Visit>
void ForEachTypePrefix(std::string_view type, Visit visit) {
  visit(type);
  for (size_t dot = type.rfind('.'); dot != std::string_view::npos;
       dot = dot == 0 ? std::string_view::npos : type.rfind('.', dot - 1)) {
    visit(type.substr(0, dot));
  }
}

// What the processing queue does for one prefix of an event's type: run its rules and write
// its record (entry set), or only write the record of the full type, which has no rules.
struct PrefixStep {
  const std::pair<const std::string, RulebaseEntry>* entry;  // nullptr: the record alone
  uint64_t count;  // the prefix's event counter including this event, taken at dispatch
};

// The one job of an event, with its steps in prefix order, longest first. The context is made
// here, on the processing queue, so the copies it holds are made, used and freed by one thread;
// the counters were taken at dispatch, so counts follow dispatch order. The event's records
// share one gathering of its attributes. On the serial queue this runs what separate jobs
// queued together would, in the same order.
class EventJob {
 public:
  EventJob(const SerialQueue& queue, std::shared_ptr<const plist::Dictionary> event,
           RulebasePtr rulebase, double now, VariableStorePtr variables,
           std::shared_ptr<Keychain> keychain, DryRun* dryRun)
      : mQueue(&queue),
        mEvent(std::move(event)),
        mRulebase(std::move(rulebase)),
        mNow(now),
        mVariables(std::move(variables)),
        mKeychain(std::move(keychain)),
        mDryRun(dryRun) {}

  void add(PrefixStep step) {
    if (mCount < mSteps.size()) {
      mSteps[mCount++] = step;
    } else {
      mMore.push_back(step);
    }
  }
  bool empty() const { return mCount == 0; }

  void operator()() const {
    EventRecord record(*mEvent);
    for (size_t i = 0; i < mCount; ++i) run(mSteps[i], record);
    for (const PrefixStep& step : mMore) run(step, record);
  }

 private:
  void run(const PrefixStep& step, EventRecord& record) const {
    if (mQueue->abandoned()) return;
    if (step.entry == nullptr) {
      SerialQueue::BlockingSection blocking;
      record.write(false, false);
      return;
    }
    const std::string& prefix = step.entry->first;
    const std::vector<RulePtr>& rules = step.entry->second.rules;
    if (mDryRun) mDryRun->note("type prefix %s: %zu rules", prefix.c_str(), rules.size());
    Context context(mVariables, mRulebase, *mEvent, mKeychain);
    plist::Dictionary& metadata = context.eventMetadata();
    metadata.reserve(2);
    metadata.set(prefix + ":eventCounter", plist::Value::Integer(static_cast<int64_t>(step.count)));
    metadata.set(prefix + ":lastEventTimestamp", plist::Value::Real(mNow));

    bool fired = false;
    for (const RulePtr& rule : rules) {
      // Abandoned while an earlier rule was stuck: the rules not started are dropped, as
      // queued jobs are, and the event's records with them.
      if (mQueue->abandoned()) return;
      const auto start = std::chrono::steady_clock::now();
      const bool didFire = ProcessRule(*rule, context, mDryRun);
      fired = fired || didFire;
      if (mDryRun == nullptr) {
        const std::chrono::duration<double> spent = std::chrono::steady_clock::now() - start;
        Statistics().ruleRan(*rule, didFire, spent.count());
      }
    }
    if (mDryRun) return;
    // The record touches no variable: a journal that stops taking records must not keep
    // shutdown from saving the store.
    SerialQueue::BlockingSection blocking;
    const bool hasRules = !rules.empty();
    record.write(hasRules, hasRules && !fired);
  }

  const SerialQueue* mQueue;
  std::shared_ptr<const plist::Dictionary> mEvent;
  RulebasePtr mRulebase;  // keeps the entries and their keys alive
  double mNow;
  VariableStorePtr mVariables;
  std::shared_ptr<Keychain> mKeychain;
  DryRun* mDryRun;
  // Nearly every event has one or two steps; a type of many components spills over.
  std::array<PrefixStep, 3> mSteps{};
  size_t mCount = 0;
  std::vector<PrefixStep> mMore;
};

}  // namespace

std::string PathExtension(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  const std::string name = std::filesystem::path(path).filename().string();
  const size_t dot = name.rfind('.');
  if (dot == std::string::npos || dot == 0 || dot + 1 == name.size()) return "";
  return name.substr(dot + 1);
}

Engine::Engine(const Clock& clock, plist::Dictionary globals)
    : mClock(clock),
      mQueue(std::make_unique<SerialQueue>("com.quenta.tarvod.processq")),
      mVariables(std::make_shared<VariableStore>()),
      mRulebase(std::make_shared<const Rulebase>()) {
  BuildKeywordTables();
  mVariables->set(kGlobalsKey, plist::Value(std::move(globals)));
  // Records are written in batches, one write for all the records of the jobs run since the
  // queue was last idle, so that a busy queue does not pay a write per record.
  // Kept log files look their paths up again once per batch.
  mQueue->setIdleHandler([] {
    FlushStructuredLog();
    EndLogBatch();
  });
  mQueue->async(HoldStructuredLogRecordsOnThisThread);
}

Engine::~Engine() {
  if (mAbandoned) {
    // A job may still be stuck in a blocking call: joining its thread would hang the exit.
    // The queue stays reachable, and the process ends around it.
    static auto* const stuck = new std::vector<std::unique_ptr<SerialQueue>>;
    stuck->push_back(std::move(mQueue));
  }
}

void Engine::dispatchEvent(const plist::Dictionary& event) { dispatch(event, nullptr, nullptr); }

void Engine::dispatchEvent(plist::Dictionary&& event) { dispatch(event, &event, nullptr); }

std::vector<std::string> Engine::dryRunEvent(const plist::Dictionary& event) {
  DryRun dryRun;
  withVariables(
      [&](VariableStore& store) { dryRun.variables = std::make_shared<VariableStore>(store); });
  dispatch(event, nullptr, &dryRun);
  withVariables([](VariableStore&) {});  // after the event's jobs
  return std::move(dryRun.lines);
}

void Engine::dispatch(const plist::Dictionary& event, plist::Dictionary* owned, DryRun* dryRun) {
  if (!mDispatchOpen.load()) return;
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
  if (dryRun == nullptr) {
    LogEvent(event);
    Statistics().eventDispatched();
  }
  LogMessage(1, "EVENT RECEIVED: %s", type.c_str());

  const RulebasePtr rulebase = this->rulebase();
  const double now = mClock.now();
  // One event shared by every job of this dispatch: the caller's own when it handed it over.
  const auto shared = owned ? std::make_shared<const plist::Dictionary>(std::move(*owned))
                            : std::make_shared<const plist::Dictionary>(event);
  EventJob job(*mQueue, shared, rulebase, now, dryRun ? dryRun->variables : mVariables, mKeychain,
               dryRun);
  ForEachTypePrefix(type, [&](std::string_view prefix) {
    auto found = rulebase->find(prefix);
    if (found != rulebase->end()) {
      LogMessage(2, "  Processing event: %.*s", static_cast<int>(prefix.size()), prefix.data());
      // The counter runs in the rulebase entry, so "prefix:eventCounter" counts the events of
      // this prefix since the rules were loaded (a reload starts a new rulebase at 0); the
      // context's copy is the count including this event. A dry run leaves both alone.
      const RulebaseEntry& entry = found->second;
      uint64_t count = entry.eventCounter.load(std::memory_order_relaxed) + 1;
      if (dryRun == nullptr) {
        count = entry.eventCounter.fetch_add(1, std::memory_order_relaxed) + 1;
        entry.lastEventTimestamp.store(now, std::memory_order_relaxed);
      }
      job.add(PrefixStep{&*found, count});
      return;
    }
    if (prefix.size() == type.size() && dryRun == nullptr) {
      // The record of a type without rules is written by the processing queue too, in the
      // order of the queue's other records: the dispatching thread (the input queue) then
      // does no file or journal I/O of its own, and the record joins the queue's batch.
      job.add(PrefixStep{nullptr, 0});
    }
    LogMessage(2, "  Dropping event %.*s because it has no associated rules",
               static_cast<int>(prefix.size()), prefix.data());
  });
  if (!job.empty()) mQueue->async(std::move(job));
}

plist::Dictionary Engine::daemonEvent(const char* type) const {
  return plist::Dictionary{
      {"eventType", plist::Value(type)},
      {"eventTimestamp", plist::Value::Real(mClock.now())},
      {"eventSource", plist::Value("tarvod")},
  };
}

void Engine::postStartupEvent(bool reload) {
  dispatchEvent(daemonEvent(reload ? "startup.reload" : "startup.load"));
}

void Engine::postShutdownEvent() { dispatchEvent(daemonEvent("shutdown")); }

RulebasePtr Engine::loadRules(const std::string& path, size_t* count, LoadReport* report) {
  std::error_code error;
  const bool directory = PathExtension(path).empty() || std::filesystem::is_directory(path, error);
  auto rulebase = std::make_shared<Rulebase>();
  size_t loaded = 0;
  withVariables([&](VariableStore&) {
    // A reload also picks up a store replaced with its old modification time.
    if (mKeychain) mKeychain->forget();
    loaded = directory ? LoadRulesDirectory(*rulebase, mVariables, path, mKeychain, report)
                       : LoadRulesFile(*rulebase, mVariables, path, mKeychain, report);
  });
  if (count) *count = loaded;
  return rulebase;
}

RulebasePtr Engine::rulebase() const {
  std::lock_guard<std::mutex> lock(mRulebaseLock);
  return mRulebase;
}

void Engine::swapRulebase(RulebasePtr rulebase) {
  RulebasePtr replaced;
  {
    std::lock_guard<std::mutex> lock(mRulebaseLock);
    replaced = std::exchange(mRulebase, std::move(rulebase));
  }
  // The previous generation is released outside the lock: freeing a large rulebase must not
  // hold up dispatching threads.
  mPreviousRulebase = std::move(replaced);
  Statistics().forgetRules();
}

bool Engine::withVariables(const std::function<void(VariableStore&)>& work) {
  if (mAbandoned) return mQueue->runExclusive([&] { work(*mVariables); }, 1.0);
  mQueue->sync([&] { work(*mVariables); });
  return true;
}

size_t Engine::drain(double seconds) {
  if (mQueue->drainFor(seconds)) return 0;
  const size_t pending = mQueue->pending();
  mQueue->abandon();
  mAbandoned = true;
  // The records of the jobs that did run are not left behind with the stuck one.
  FlushStructuredLog();
  return pending;
}

}  // namespace tarvod
