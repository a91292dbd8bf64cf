// The action handlers behind the action keywords. Each handler is one object behind this
// interface, one file each; a handler runs on the processing queue for a rule that fired, and
// its failures are logged and end only that action.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "context/context.h"
#include "plist/value.h"

namespace tarvod {

// The rule an action belongs to, with the keys every handler needs read once.
struct FiredRule {
  const Rule& rule;
  // Views of the rule's own texts, valid while its actions run.
  std::string_view name;      // "(null)" when the rule has none
  std::string_view filePath;  // empty when the rule has none
};

class Action {
 public:
  virtual ~Action() = default;
  virtual void perform(const plist::Dictionary& action, const FiredRule& rule,
                       Context& context) = 0;
  // A dry run: resolves the action as perform would and says what it would do (the line, the
  // command and user, the recipients) without doing it; nullopt when resolving failed (and was
  // logged) so that perform would do nothing. Resolving may read the variable store but never
  // changes it. A handler without its own description is only named.
  virtual std::optional<std::string> describe(const plist::Dictionary& action,
                                              const FiredRule& rule, Context& context) {
    return std::string("would run (this action does not describe itself)");
  }
};

// The text form of action[key] after substitution. The outer nullopt means "stop the action":
// the substitution failed and "Error: %s" was logged at level 0. An absent key, or a
// reference to nothing, gives an absent text.
std::optional<std::optional<std::string>> ResolveActionText(const plist::Dictionary& action,
                                                            std::string_view key,
                                                            const FiredRule& rule,
                                                            Context& context);

// action[key] resolved as a value of any kind (arrays and dictionaries element by element),
// with the same outer nullopt on a failed substitution.
std::optional<std::optional<plist::Value>> ResolveActionValue(const plist::Dictionary& action,
                                                              std::string_view key,
                                                              const FiredRule& rule,
                                                              Context& context);

}  // namespace tarvod
