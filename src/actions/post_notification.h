// The "postnotification" action: posts a distributed notification whose name and object
// (the action's `message`) come from the rule, and whose user information is the event
// being processed with the rule's `details` stored over it. Runs on the processing queue;
// posting hands the notification to the center and never waits for the bus.
#pragma once

#include "actions/action.h"
#include "platform/notification_center.h"

namespace tarvod {

class PostNotificationAction final : public Action {
 public:
  // center must outlive the action.
  explicit PostNotificationAction(NotificationCenter& center) : mCenter(center) {}
  void perform(const plist::Dictionary& action, const FiredRule& rule, Context& context) override;
  std::optional<std::string> describe(const plist::Dictionary& action, const FiredRule& rule,
                                      Context& context) override;

 private:
  // The notification perform posts; nullopt (logged) when there is none to post.
  std::optional<Notification> resolve(const plist::Dictionary& action, const FiredRule& rule,
                                      Context& context);

  NotificationCenter& mCenter;
};

}  // namespace tarvod
