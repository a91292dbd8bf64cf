// The "debugdump" action: writes the action, the rule, the context, the globals or the
// rulebase to the error log at level 2, as its "data" key selects.
#pragma once

#include "actions/action.h"

namespace tarvod {

class DebugDumpAction final : public Action {
 public:
  void perform(const plist::Dictionary& action, const FiredRule& rule, Context& context) override;
};

}  // namespace tarvod
