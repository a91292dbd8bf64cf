// Rule processing: criteria, variables and actions of one rule for one event. Runs only on
// the processing queue.
#pragma once

#include <string>

#include "actions/action.h"
#include "context/context.h"

namespace tarvod {

// Evaluates one criterion entry; true when it passes.
bool ProcessCriteria(const plist::Dictionary& criterion, const Rule& rule, Context& context);
// True when the user is a member of the group (primary or supplementary); false when either
// does not exist.
bool IsUserInGroup(const std::string& user, const std::string& group);
// Runs one action entry of a fired rule.
void ProcessAction(const plist::Dictionary& action, const FiredRule& rule, Context& context);
// The time limit in seconds of run-command actions without their own; 0: none.
void SetDefaultCommandTimeout(double seconds);
// The programs of the mail actions: the local mail command and the relay helper.
void SetMailPrograms(const std::string& local, const std::string& relay);
// True when the rule fired.
bool ProcessRule(const Rule& rule, Context& context);

}  // namespace tarvod
