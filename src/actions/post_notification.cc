#include "actions/post_notification.h"

#include "platform/diagnostic_log.h"

namespace tarvod {
namespace {

std::string Written(const plist::Value* value) {
  if (value == nullptr) return "(null)";
  return value->isString() ? value->string() : plist::Describe(*value);
}

}  // namespace

std::optional<Notification> PostNotificationAction::resolve(const plist::Dictionary& action,
                                                            const FiredRule& rule,
                                                            Context& context) {
  const plist::Value* details = action.find("details");
  LogMessage(4, "DoNotificationAction (unresolved): name = %s message = %s details = %s",
             Written(action.find("name")).c_str(), Written(action.find("message")).c_str(),
             Written(details).c_str());

  const auto name = ResolveActionText(action, "name", rule, context);
  if (!name) return std::nullopt;
  const auto message = ResolveActionText(action, "message", rule, context);
  if (!message) return std::nullopt;
  plist::Dictionary resolvedDetails;
  if (details != nullptr) {
    if (!details->isDictionary()) {
      LogMessage(0, "DoNotificationAction: details is not a dictionary; nothing posted");
      return std::nullopt;
    }
    std::optional<std::optional<plist::Value>> resolved =
        ResolveActionValue(action, "details", rule, context);
    if (!resolved) return std::nullopt;
    if (*resolved && (*resolved)->isDictionary()) {
      resolvedDetails = std::move((*resolved)->dictionary());
    }
  }
  // A notification needs a name to be posted under.
  if (!*name) {
    LogMessage(0, "DoNotificationAction: the action has no name; nothing posted");
    return std::nullopt;
  }

  // A copy of the event as the context holds it; the context's own event stays unchanged.
  plist::Dictionary userInfo = context.event() ? *context.event() : plist::Dictionary();
  for (auto& [key, value] : resolvedDetails) userInfo.set(key, std::move(value));
  LogMessage(3, "DoNotificationAction: name = %s message = %s details = %s", name->value().c_str(),
             message->value_or("(null)").c_str(), plist::Describe(userInfo).c_str());
  return Notification{**name, message->value_or(""), std::move(userInfo)};
}

void PostNotificationAction::perform(const plist::Dictionary& action, const FiredRule& rule,
                                     Context& context) {
  std::optional<Notification> notification = resolve(action, rule, context);
  if (!notification) return;
  const std::string name = notification->name;
  const Status posted = mCenter.post(std::move(*notification));
  if (!posted.ok()) {
    LogMessage(0, "DoNotificationAction: %s not posted: %s", name.c_str(), posted.what().c_str());
  }
}

std::optional<std::string> PostNotificationAction::describe(const plist::Dictionary& action,
                                                            const FiredRule& rule,
                                                            Context& context) {
  const std::optional<Notification> notification = resolve(action, rule, context);
  if (!notification) return std::nullopt;
  return "would post " + notification->name + " with object \"" +
         context.shownText(notification->object) + "\" and user information " +
         context.shownValue(plist::Value(notification->userInfo.value_or(plist::Dictionary())));
}

}  // namespace tarvod
