#include "engine/stats.h"

#include <algorithm>

namespace tarvod {

void EngineStats::ruleRan(const Rule& rule, bool fired, double seconds) {
  std::lock_guard<std::mutex> lock(mLock);
  auto [it, added] = mRules.try_emplace(&rule);
  RuleStats& stats = it->second;
  if (added) {
    const plist::Value* name = rule.find("name");
    const std::string* file = rule.findString("filePath");
    stats.name = name ? name->textForm() : "(null)";
    stats.file = file ? *file : "";
  }
  ++stats.runs;
  if (fired) ++stats.fired;
  stats.seconds += seconds;
  stats.maxSeconds = std::max(stats.maxSeconds, seconds);
}

void EngineStats::actionRan(long code, bool failed) {
  if (code < 0 || static_cast<size_t>(code) >= kActionCodes) return;
  mActions[code].run.fetch_add(1, std::memory_order_relaxed);
  if (failed) mActions[code].failed.fetch_add(1, std::memory_order_relaxed);
}

void EngineStats::forgetRules() {
  std::lock_guard<std::mutex> lock(mLock);
  mRules.clear();
}

std::vector<RuleStats> EngineStats::rules() const {
  std::lock_guard<std::mutex> lock(mLock);
  std::vector<RuleStats> list;
  for (const auto& [rule, stats] : mRules) list.push_back(stats);
  std::sort(list.begin(), list.end(), [](const RuleStats& a, const RuleStats& b) {
    return a.file != b.file ? a.file < b.file : a.name < b.name;
  });
  return list;
}

EngineStats& Statistics() {
  static EngineStats stats;
  return stats;
}

}  // namespace tarvod
