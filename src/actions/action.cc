#include "actions/action.h"

#include "platform/diagnostic_log.h"

namespace tarvod {

std::optional<std::optional<std::string>> ResolveActionText(const plist::Dictionary& action,
                                                            std::string_view key,
                                                            const FiredRule& rule,
                                                            Context& context) {
  const plist::Value* value = action.find(key);
  if (value == nullptr) return std::optional<std::string>();
  ErrorSlot error;
  std::optional<plist::Value> resolved =
      context.resolveVariablesInString(value->textForm(), rule.filePath, &error);
  if (error) {
    LogMessage(0, "Error: %s", error->description.c_str());
    return std::nullopt;
  }
  if (!resolved) return std::optional<std::string>();
  return std::optional<std::string>(resolved->textForm());
}

}  // namespace tarvod
