#include "sources/notifications.h"

#include <gtest/gtest.h>

#include "platform/testing/fake_notification_center.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Dictionary;

MonitorHooks DispatchInto(std::vector<Dictionary>& events) {
  MonitorHooks hooks;
  hooks.dispatch = [&events](const Dictionary& event) { events.push_back(event); };
  return hooks;
}

Rulebase Keys(std::initializer_list<const char*> types) {
  Rulebase rulebase;
  for (const char* type : types) rulebase[type];
  return rulebase;
}

// Registration, delivery by object and the hold across a reload, against the fake center;
// the bus itself is tested in notification_center_test.cc and end to end in tests/.
TEST(Notifications, ObservationsFollowTheRulebaseAndAReloadLosesNothing) {
  testing::LogCapture capture(5);
  std::vector<Dictionary> dispatched;
  Monitor monitor(DispatchInto(dispatched));
  FakeNotificationCenter center;
  const Dictionary typeB{{"eventType", "b"}};

  const Rulebase old = Keys({"a", "b", "c"});
  EXPECT_EQ(RegisterNotifications(center, old, monitor), 3);
  EXPECT_EQ(center.observations(), 3u);
  center.receive({"n", "a", typeB});          // object a, eventType b: dispatched as b
  center.receive({"n", "elsewhere", typeB});  // not observed
  center.receive({"bare", "c", std::nullopt});
  EXPECT_EQ(dispatched, (std::vector<Dictionary>{typeB, Dictionary()}));

  // As ReloadRules does it: held while the observations change, delivered to the new ones.
  dispatched.clear();
  center.suspend();
  UnregisterNotifications(center, old, monitor);
  EXPECT_EQ(center.observations(), 0u);
  center.receive({"n", "d", typeB});
  center.receive({"n", "a", typeB});
  EXPECT_EQ(RegisterNotifications(center, Keys({"d"}), monitor), 1);
  EXPECT_TRUE(dispatched.empty());
  center.resume();
  EXPECT_EQ(dispatched, (std::vector<Dictionary>{typeB}));

  EXPECT_TRUE(testing::LinesInOrder(
      capture.text(),
      {"REGISTERING EVENTS", "  Registering a", "  Registering c", "Registered 3 events",
       "NOTIFICATION RECEIVED: n ", "Description:\n{\n    name = n;\n    object = a;",
       "    de-registering a", "Registered 1 events"}));
}

}  // namespace
}  // namespace tarvod
