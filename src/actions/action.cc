#include "actions/action.h"

#include "platform/diagnostic_log.h"

namespace tarvod {

namespace {

// The outer nullopt after logging the substitution's error; otherwise what it resolved to.
std::optional<std::optional<plist::Value>> Checked(std::optional<plist::Value> resolved,
                                                   const ErrorSlot& error) {
  if (error) {
    LogMessage(0, "Error: %s", error->description.c_str());
    return std::nullopt;
  }
  return std::optional<std::optional<plist::Value>>(std::move(resolved));
}

}  // namespace

std::optional<std::optional<std::string>> ResolveActionText(const plist::Dictionary& action,
                                                            std::string_view key,
                                                            const FiredRule& rule,
                                                            Context& context) {
  const plist::Value* value = action.find(key);
  if (value == nullptr) return std::optional<std::string>();
  ErrorSlot error;
  // The text is resolved where it stands, and the result's string taken rather than copied.
  const std::string* text = value->asString();
  std::string formed;
  if (text == nullptr) formed = value->textForm();
  auto resolved = Checked(
      context.resolveVariablesInString(text ? *text : formed, rule.filePath, &error), error);
  if (!resolved) return std::nullopt;
  if (!*resolved) return std::optional<std::string>();
  if (std::string* string = (*resolved)->asString()) {
    return std::optional<std::string>(std::move(*string));
  }
  return std::optional<std::string>((*resolved)->textForm());
}

std::optional<std::optional<plist::Value>> ResolveActionValue(const plist::Dictionary& action,
                                                              std::string_view key,
                                                              const FiredRule& rule,
                                                              Context& context) {
  const plist::Value* value = action.find(key);
  if (value == nullptr) return std::optional<plist::Value>();
  ErrorSlot error;
  return Checked(context.resolveVariablesInObject(*value, rule.filePath, &error), error);
}

}  // namespace tarvod
