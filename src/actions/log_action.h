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

// Configuration key keepLogFilesOpen (default false: every line opens, writes and closes its
// file). When true, files written by log actions stay open between lines (at most
// kMaxKeptLogFiles, the least recently used closed first). A kept file is opened afresh when
// its path names another file or none (the path is looked up at most once per batch, see
// EndLogBatch), and after ReopenKeptLogFiles, so that rotation by renaming keeps working. Any
// thread.
void SetKeepLogFilesOpen(bool keep);
inline constexpr size_t kMaxKeptLogFiles = 32;
// Kept files are opened afresh before their next line (a reload asks for it). Any thread.
void ReopenKeptLogFiles();
// The processing queue ran out of work: the next line of each kept file looks its path up
// again. Any thread.
void EndLogBatch();

}  // namespace tarvod
