// Rule processing: criteria, variables and actions of one rule for one event. Runs only on
// the processing queue.
#pragma once

#include <string>
#include <vector>

#include "actions/action.h"
#include "context/context.h"

namespace tarvod {

// A dry run's report: for each rule, its criteria with their resolved operands and results,
// whether it fires, the variables it sets and what each action would do. The rules of a dry
// run work on a copy of the variable store and their actions only describe themselves.
// Written on the processing queue, read once the event's jobs have run.
struct DryRun {
  VariableStorePtr variables;  // the copy the dry run's rules read and write
  std::vector<std::string> lines;
  void note(const char* format, ...) __attribute__((format(printf, 2, 3)));
};

// Evaluates one criterion entry; true when it passes. With dryRun, notes the comparison.
bool ProcessCriteria(const plist::Dictionary& criterion, const Rule& rule, Context& context,
                     DryRun* dryRun = nullptr);
// True when the user is a member of the group (primary or supplementary); false when either
// does not exist.
bool IsUserInGroup(const std::string& user, const std::string& group);
// Runs one action entry of a fired rule; with dryRun, notes what it would do instead.
void ProcessAction(const plist::Dictionary& action, const FiredRule& rule, Context& context,
                   DryRun* dryRun = nullptr);
// The time limit in seconds of run-command actions without their own; 0: none.
void SetDefaultCommandTimeout(double seconds);
// The programs of the mail actions: the local mail command and the relay helper.
void SetMailPrograms(const std::string& local, const std::string& relay);
// True when the rule fired. dryRun: see DryRun.
bool ProcessRule(const Rule& rule, Context& context, DryRun* dryRun = nullptr);

}  // namespace tarvod
