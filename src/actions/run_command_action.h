// The "runcommand" action: runs a program directly (no shell, no search of a path list) in a
// child process as a chosen user and group, its standard streams on files, and waits for it
// so that the rule's later actions see its effects. Runs on the processing queue; the
// look-ups and the wait happen in a blocking section, so that shutdown can save state while a
// command hangs. Failures are logged and end only the action.
#pragma once

#include <atomic>

#include "actions/action.h"
#include "platform/process_launcher.h"

namespace tarvod {

class RunCommandAction final : public Action {
 public:
  explicit RunCommandAction(ProcessLauncher& launcher) : mLauncher(launcher) {}
  void perform(const plist::Dictionary& action, const FiredRule& rule, Context& context) override;
  std::optional<std::string> describe(const plist::Dictionary& action, const FiredRule& rule,
                                      Context& context) override;

  // The time limit, in seconds, of actions without a "timeout" key; 0 (the default) waits
  // without one. Any thread.
  void setDefaultTimeout(double seconds) { mDefaultTimeout.store(seconds); }

 private:
  struct Resolved {
    LaunchRequest request;
    plist::Array arguments;  // as resolved, for the trace
    double limit = 0;
  };
  // Everything perform launches: substitution done, user and group looked up; nullopt (logged)
  // when the action ends before launching.
  std::optional<Resolved> resolve(const plist::Dictionary& action, const FiredRule& rule,
                                  Context& context);

  ProcessLauncher& mLauncher;
  std::atomic<double> mDefaultTimeout{0};
};

}  // namespace tarvod
