// Checks of rules: what the loader would skip or misread and what would fail once the rule
// runs (an unknown key, operator or action type, a value of the wrong kind, a reference that can
// never resolve), each as a Problem naming the file, the rule and the key path. The loader runs
// them on every file it reads, so the daemon's startup and `tarvodctl check` report the same
// problems with the same text. Pure functions; any thread.
#pragma once

#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "plist/value.h"

namespace tarvod {

struct Problem {
  enum class Severity { kWarning, kError };
  Severity severity = Severity::kError;
  std::string file;
  size_t rule = 0;       // counted from 1; 0 when the problem concerns the whole file
  std::string ruleName;  // as written; empty when the rule has none
  std::string keyPath;   // "criterion[1].operator", indices counted from 1; may be empty
  std::string message;
};

// A problem of a whole file (rule 0, no key path).
Problem FileProblem(std::string file, std::string message,
                    Problem::Severity severity = Problem::Severity::kError);

// `FILE: rule N "NAME": KEYPATH: MESSAGE`, the parts that are empty left out.
std::string FormatProblem(const Problem& problem);

// What one load read and found: the summary the daemon logs after loading and the report of
// `tarvodctl check`.
struct LoadReport {
  size_t filesRead = 0;     // files read as property-list arrays of rules
  size_t filesSkipped = 0;  // unreadable, not a property-list array, or an editor's leftover
  size_t rulesLoaded = 0;
  std::vector<Problem> problems;

  size_t count(Problem::Severity severity) const;
  void add(Problem problem) { problems.push_back(std::move(problem)); }
};

// Appends the problems of one element of a rules file (index counted from 1).
void CheckRule(const plist::Value& element, const std::string& file, size_t index,
               std::vector<Problem>& problems);

// Problems of the "${...}" references in a text: an unterminated "${", nesting deeper than the
// substitution allows, a namespace nothing answers to, a format suffix that is not applied.
// Each message is one sentence without the key path.
std::vector<std::string> ReferenceProblems(std::string_view text);

// The candidate nearest to word by edit distance, when it is near enough to be a misspelling.
std::optional<std::string_view> NearestName(std::string_view word,
                                            std::span<const std::string_view> candidates);
// " (did you mean "NAME"?)" for the nearest candidate, or "".
std::string Suggestion(std::string_view word, std::span<const std::string_view> candidates);

}  // namespace tarvod
