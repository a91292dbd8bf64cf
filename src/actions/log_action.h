// The "log" action: one message, after substitution, to the structured system log or appended
// as one line to a file. Runs on the processing queue; BuildLevelNameTable runs once at
// startup, before any rule. Failures are logged and end only the action.
#pragma once

#include "actions/action.h"

namespace tarvod {

class LogAction final : public Action {
 public:
  void perform(const plist::Dictionary& action, const FiredRule& rule, Context& context) override;
  std::optional<std::string> describe(const plist::Dictionary& action, const FiredRule& rule,
                                      Context& context) override;
};
// Builds the level-name table ("emergency" 0 to "debug" 7); later calls leave it as it is.
void BuildLevelNameTable();

}  // namespace tarvod
