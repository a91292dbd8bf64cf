#include "actions/run_command_action.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/testing/fake_process_launcher.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Array;
using plist::Dictionary;
using plist::Value;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

constexpr const char* kRulesFile = "/rules/commands.plist";

class RunCommandTest : public ::testing::Test {
 protected:
  void SetUp() override {
    auto store = std::make_shared<VariableStore>();
    store->set(kGlobalsKey, Dictionary{{"pair", Array{Value("x"), Value("y")}},
                                       {"count", Value::Integer(5)},
                                       {"dir", Value("/srv")}});
    context_ = std::make_unique<Context>(store, std::make_shared<Rulebase>(),
                                         Dictionary{{"eventType", "t"}, {"host", "a:b"}});
  }
  void Run(Dictionary action) {
    action.set("type", Value("runcommand"));
    const Dictionary rule{{"filePath", kRulesFile}};
    handler_.perform(action, FiredRule{rule, "commands", kRulesFile}, *context_);
  }

  testing::LogCapture capture_{3};
  FakeProcessLauncher launcher_;
  RunCommandAction handler_{launcher_};
  std::unique_ptr<Context> context_;
};

TEST_F(RunCommandTest, OnlyACommandRunsAsUser99Group99InTheRootWithStreamsOnDevNull) {
  Run(Dictionary{{"command", "/bin/true"}, {"environment", Dictionary{}}});
  ASSERT_EQ(launcher_.requests.size(), 1u);
  const LaunchRequest& request = launcher_.requests[0];
  EXPECT_EQ(request.program, "/bin/true");
  EXPECT_THAT(request.arguments, ElementsAre("/bin/true"));
  EXPECT_FALSE(request.environment.has_value());  // an empty one is the daemon's own
  ASSERT_TRUE(request.identity.has_value());
  EXPECT_EQ(request.identity->uid, 99u);
  EXPECT_EQ(request.identity->gid, 99u);
  EXPECT_THAT(request.identity->groups, ElementsAre(99u));
  EXPECT_EQ(request.workingDirectory, "/");
  EXPECT_TRUE(request.chdirFailure.text.empty());
  const int flags[3] = {O_RDONLY, O_WRONLY | O_CREAT | O_APPEND, O_WRONLY | O_CREAT | O_APPEND};
  for (int i = 0; i < 3; ++i) {
    EXPECT_EQ(request.redirections[i].path, "/dev/null");
    EXPECT_EQ(request.redirections[i].flags, flags[i]);
    EXPECT_EQ(request.redirections[i].descriptor, -1);
  }
  EXPECT_EQ(request.redirections[1].mode, 0640u);
  EXPECT_EQ(request.redirections[0].failure.text,
            "DoRunAction (child): Redirect of stdin to /dev/null failed errno = ");
  EXPECT_THAT(launcher_.waits, ElementsAre(std::nullopt));
}

TEST_F(RunCommandTest, BuildsTheArgumentsAndEnvironmentFromTheirResolvedValues) {
  Run(Dictionary{
      {"command", "/bin/echo\\:${global:count}"},
      {"arguments", Array{Value("${global:pair}"), Value("${global:count}"), Value("a\\:b"),
                          Value("${event:host}"), Value("in ${global:dir}"),
                          Value(Array{Value("p"), Value::Integer(2)})}},
      {"workingDirectory", "${global:dir}"},
      {"environment", Dictionary{{"PATH", "/bin"}, {"N", "${global:count}"}}},
  });
  ASSERT_EQ(launcher_.requests.size(), 1u);
  const LaunchRequest& request = launcher_.requests[0];
  ASSERT_TRUE(request.environment.has_value());
  EXPECT_THAT(*request.environment, ElementsAre("PATH=/bin", "N=5"));
  // The command keeps its escape; every string argument loses it; arrays are joined.
  EXPECT_EQ(request.program, "/bin/echo\\:5");
  EXPECT_THAT(request.arguments,
              ElementsAre("/bin/echo\\:5", "x,y", "5", "a:b", "a:b", "in /srv", "p,2"));
  EXPECT_EQ(request.workingDirectory, "/srv");
  EXPECT_EQ(request.chdirFailure.text, "DoRunAction (child): chdir to /srv failed");
  // The trace shows each argument's text form, an array's over several lines.
  EXPECT_THAT(capture_.text(),
              HasSubstr("    Executing command:\n      /bin/echo\\:5 \"(\n    x,\n    y\n)\" "
                        "\"5\" \"a:b\" \"a:b\" \"in /srv\""));
}

TEST_F(RunCommandTest, EndsTheActionWithoutAChildOnEveryFailureBeforeTheStart) {
  const struct {
    Dictionary action;
    const char* message;
  } cases[] = {
      {Dictionary{{"command", "/bin/true"}, {"user", "tarvod-no-such-user"}},
       "DoRunAction: User 'tarvod-no-such-user' not found. Aborting action\n"},
      {Dictionary{{"command", "/bin/true"}, {"group", "tarvod-no-such-group"}},
       "DoRunAction: Group 'tarvod-no-such-group' not found. Aborting action\n"},
      {Dictionary{{"command", "/bin/true"}, {"stdoutPath", "out ${p"}},
       "Error: Unterminated token"},
      {Dictionary{{"arguments", Array{Value("a")}}}, "DoRunAction: No command to run."},
  };
  for (const auto& c : cases) {
    Run(c.action);
    EXPECT_THAT(capture_.text(), HasSubstr(c.message));
  }
  EXPECT_TRUE(launcher_.requests.empty());
}

TEST_F(RunCommandTest, TakesTheUsersGroupsWithTheChosenGroup) {
  Run(Dictionary{{"command", "/bin/true"}, {"user", "root"}, {"group", "root"}});
  ASSERT_EQ(launcher_.requests.size(), 1u);
  const Identity& identity = *launcher_.requests[0].identity;
  EXPECT_EQ(identity.uid, 0u);
  EXPECT_EQ(identity.gid, 0u);
  ASSERT_FALSE(identity.groups.empty());
  EXPECT_EQ(identity.groups.front(), 0u);
  // The group default does not follow the user.
  Run(Dictionary{{"command", "/bin/true"}, {"user", "root"}});
  EXPECT_EQ(launcher_.requests[1].identity->gid, 99u);
  EXPECT_EQ(launcher_.requests[1].identity->groups.front(), 99u);
}

TEST_F(RunCommandTest, EndsAProgramThatOutlivesItsLimitAndTakesTheDefaultWithoutOne) {
  launcher_.runsForever = true;
  handler_.setDefaultTimeout(30);
  Run(Dictionary{{"command", "/bin/sleep"}, {"timeout", "1.5"}});
  Run(Dictionary{{"command", "/bin/sleep"}});
  Run(Dictionary{{"command", "/bin/sleep"}, {"timeout", Value::Integer(0)}});
  Run(Dictionary{{"command", "/bin/sleep"}, {"timeout", "soon"}});
  EXPECT_THAT(launcher_.waits, ElementsAre(1.5, 30.0, std::nullopt, 30.0));
  EXPECT_EQ(launcher_.terminations, 3);
  const std::string log = capture_.text();
  EXPECT_THAT(log, HasSubstr("DoRunAction: /bin/sleep still running after 1.5 seconds; ending "
                             "its process group (SIGTERM, SIGKILL 2 seconds later)\n"));
  EXPECT_THAT(log, HasSubstr("DoRunAction: The value for timeout is not a number of seconds: "
                             "soon\n"));
}

TEST_F(RunCommandTest, AFailedStartEndsTheActionSilently) {
  launcher_.failLaunch = true;
  Run(Dictionary{{"command", "/bin/true"}});
  EXPECT_TRUE(launcher_.waits.empty());
  EXPECT_THAT(capture_.text(), ::testing::Not(HasSubstr("DoRunAction")));
}

}  // namespace
}  // namespace tarvod
