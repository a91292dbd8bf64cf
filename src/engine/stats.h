// The engine's counters for `tarvodctl stats`: rules run and fired with their time, actions
// run and failed per type. Counted on the processing queue, read from any thread; counting
// costs a few relaxed atomic increments and, per rule, one uncontended lock.
#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "context/types.h"

namespace tarvod {

struct RuleStats {
  std::string name;
  std::string file;
  uint64_t runs = 0;
  uint64_t fired = 0;
  double seconds = 0;     // total time spent in the rule
  double maxSeconds = 0;  // the longest single run
};

struct ActionStats {
  std::atomic<uint64_t> run{0};
  std::atomic<uint64_t> failed{0};  // runs that reported a problem
};

class EngineStats {
 public:
  // Action codes run from 0 to 13.
  static constexpr size_t kActionCodes = 14;

  void eventDispatched() { mEvents.fetch_add(1, std::memory_order_relaxed); }
  uint64_t events() const { return mEvents.load(std::memory_order_relaxed); }
  void ruleRan(const Rule& rule, bool fired, double seconds);
  void actionRan(long code, bool failed);
  // The rules of a replaced rulebase are forgotten.
  void forgetRules();

  std::vector<RuleStats> rules() const;
  const ActionStats& action(size_t code) const { return mActions[code]; }

 private:
  std::atomic<uint64_t> mEvents{0};
  mutable std::mutex mLock;
  std::map<const Rule*, RuleStats> mRules;  // guarded by mLock
  std::array<ActionStats, kActionCodes> mActions;
};

// The process's counters.
EngineStats& Statistics();

}  // namespace tarvod
