#include "actions/post_notification.h"

#include <gtest/gtest.h>

#include "platform/testing/fake_notification_center.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Dictionary;
using plist::Value;

constexpr const char* kRulesFile = "/rules/notify.plist";

class PostNotificationTest : public ::testing::Test {
 protected:
  PostNotificationTest() {
    auto store = std::make_shared<VariableStore>();
    store->set(kGlobalsKey, Dictionary{{"who", Value("root")}});
    context_ = std::make_unique<Context>(
        store, std::make_shared<Rulebase>(),
        Dictionary{{"eventType", "auth.failure"},
                   {"eventDetails", Dictionary{{"clientIP", "10.0.0.1"}, {"url", "a:b"}}}});
  }
  std::vector<Notification> Post(Dictionary action) {
    action.set("type", Value("postnotification"));
    const Dictionary rule{{"filePath", kRulesFile}};
    PostNotificationAction(center_).perform(action, FiredRule{rule, "n", kRulesFile}, *context_);
    return center_.posted();
  }

  testing::LogCapture capture_{4};
  FakeNotificationCenter center_;
  std::unique_ptr<Context> context_;
};

TEST_F(PostNotificationTest, PostsTheEventUnderTheResolvedNameWithDetailsInThePostOnly) {
  const auto posted = Post(Dictionary{{"name", "alert.${global:who}"}, {"message", "x\\:y"}});
  ASSERT_EQ(posted.size(), 1u);
  EXPECT_EQ(posted[0].name, "alert.root");
  EXPECT_EQ(posted[0].object, "x\\:y");  // no colon unescaping
  ASSERT_TRUE(posted[0].userInfo);
  EXPECT_EQ(*posted[0].userInfo, *context_->event());  // details lifted, colons escaped
  EXPECT_EQ(*posted[0].userInfo->findString("url"), "a\\:b");
  EXPECT_TRUE(testing::LinesInOrder(
      capture_.text(), {"DoNotificationAction (unresolved): name = alert.${global:who} message = "
                        "x\\:y details = (null)",
                        "DoNotificationAction: name = alert.root message = x\\:y details = {"}));

  // Details replace event entries in the post only.
  const auto relayed =
      Post(Dictionary{{"name", "n"},
                      {"message", "m"},
                      {"details", Dictionary{{"eventType", "relayed"}, {"by", "${global:who}"}}}});
  ASSERT_EQ(relayed.size(), 2u);
  EXPECT_EQ(*relayed[1].userInfo->findString("eventType"), "relayed");
  EXPECT_EQ(*relayed[1].userInfo->findString("by"), "root");
  EXPECT_EQ(*relayed[1].userInfo->findString("clientIP"), "10.0.0.1");
  EXPECT_EQ(*context_->event()->findString("eventType"), "auth.failure");
}

TEST_F(PostNotificationTest, NothingIsPostedAfterASubstitutionErrorOrWithoutAName) {
  const Dictionary failing[] = {
      {{"name", "${global:who"}, {"message", "m"}},
      {{"name", "n"}, {"message", "m"}, {"details", Dictionary{{"k", "${global:who"}}}},
      {{"name", "n"}, {"details", "not a dictionary"}},
      {{"message", "m"}},
  };
  for (const Dictionary& action : failing) EXPECT_TRUE(Post(action).empty());
  EXPECT_NE(capture_.text().find("Error: "), std::string::npos);
  EXPECT_NE(capture_.text().find("DoNotificationAction: the action has no name"),
            std::string::npos);
}

}  // namespace
}  // namespace tarvod
