// The rule engine: owns the processing queue "com.quenta.tarvod.processq", the current and
// the previous rulebase and the variable store. dispatchEvent may be called from any thread
// and never waits for rules: it queues one job per event, which runs the rules of each
// matching type prefix in load order, writing each prefix's record after its rules (and the
// record of a full type without rules). Everything else is called from the main thread.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "context/types.h"
#include "engine/rules_check.h"
#include "platform/clock.h"
#include "platform/serial_queue.h"
#include "plist/value.h"

namespace tarvod {

class Keychain;
struct DryRun;

class Engine {
 public:
  // The store starts as { _globals = globals }; the rulebase starts empty.
  Engine(const Clock& clock, plist::Dictionary globals);
  // Runs the jobs still queued, unless the queue was abandoned with a job stuck.
  ~Engine();
  Engine(const Engine&) = delete;
  Engine& operator=(const Engine&) = delete;

  void dispatchEvent(const plist::Dictionary& event);
  // The same, keeping the event itself instead of a copy.
  void dispatchEvent(plist::Dictionary&& event);
  // The same dispatch in dry-run mode (DryRun in rule_processor.h): the rules run on a copy of
  // the variable store, event counters and records are left alone, actions only say what they
  // would do. Waits for the event's jobs and returns the report's lines. Main thread.
  std::vector<std::string> dryRunEvent(const plist::Dictionary& event);
  // "startup.load" (or "startup.reload" when reload is true) and "shutdown", from "tarvod".
  void postStartupEvent(bool reload);
  void postShutdownEvent();

  // Reads the rules at path (the whole tree when it names a directory or its last component
  // has no extension, else one file) into a new rulebase, on the queue, since "eval on load"
  // variables write the store. *count receives the number of rules loaded; report, when given,
  // what was read and every problem found.
  RulebasePtr loadRules(const std::string& path, size_t* count, LoadReport* report = nullptr);
  // The rulebase events are dispatched against.
  RulebasePtr rulebase() const;
  // One indivisible exchange: an event dispatched meanwhile sees the whole old rulebase or the
  // whole new one. The replaced rulebase stays alive as the previous one until the next swap.
  void swapRulebase(RulebasePtr rulebase);

  // Runs work with the store on the processing queue, after the jobs queued before it, and
  // waits. Once the queue has been abandoned, runs it on the calling thread as soon as no job
  // holds the store (a stuck job waits in a blocking section); false when that cannot be had
  // within a second.
  bool withVariables(const std::function<void(VariableStore&)>& work);

  // Events dispatched from now on are dropped: nothing reaches rules after the sources stop.
  void closeDispatch() { mDispatchOpen.store(false); }
  // Waits up to seconds for the queued jobs. Returns 0 when they all ran; otherwise abandons
  // the queue (jobs not started are dropped, the running one is left to finish or hang) and
  // returns how many jobs were still pending.
  size_t drain(double seconds);

  SerialQueue& queue() { return *mQueue; }

  // The keychain store that every context reads "keychain:" references from; set once, before
  // the first event and the first rules load. Loading rules makes it read the store again.
  void setKeychain(std::shared_ptr<Keychain> keychain) { mKeychain = std::move(keychain); }

 private:
  plist::Dictionary daemonEvent(const char* type) const;
  // owned, when set, is event itself, which may be moved from once read; dryRun, when set,
  // collects the report of a dry run.
  void dispatch(const plist::Dictionary& event, plist::Dictionary* owned, DryRun* dryRun);

  const Clock& mClock;
  std::unique_ptr<SerialQueue> mQueue;
  VariableStorePtr mVariables;
  std::shared_ptr<Keychain> mKeychain;  // used on the processing queue only
  // Guards the reference only: readers copy it and let go at once. (A mutex rather than
  // std::atomic<shared_ptr>, whose libstdc++ lock bit ThreadSanitizer cannot see.)
  mutable std::mutex mRulebaseLock;
  RulebasePtr mRulebase;
  RulebasePtr mPreviousRulebase;  // main thread only
  std::atomic<bool> mDispatchOpen{true};
  bool mAbandoned = false;
};

// The extension of a path's last component ("rules.plist" -> "plist", "rules/" -> "").
std::string PathExtension(std::string path);

}  // namespace tarvod
