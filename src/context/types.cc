#include "context/types.h"

namespace tarvod {

plist::Value RulebaseToValue(const Rulebase& rulebase) {
  plist::Dictionary result;
  for (const auto& [type, entry] : rulebase) {
    plist::Array rules;
    rules.reserve(entry.rules.size());
    for (const RulePtr& rule : entry.rules) rules.emplace_back(*rule);
    result.set(type,
               plist::Dictionary{
                   {"rules", plist::Value(std::move(rules))},
                   {"eventCounter",
                    plist::Value::Integer(static_cast<int64_t>(entry.eventCounter.load()))},
                   {"lastEventTimestamp", plist::Value::Real(entry.lastEventTimestamp.load())},
               });
  }
  return plist::Value(std::move(result));
}

}  // namespace tarvod
