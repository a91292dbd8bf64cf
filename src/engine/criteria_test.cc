#include <gtest/gtest.h>

#include "engine/keyword_tables.h"
#include "engine/rule_processor.h"
#include "platform/diagnostic_log.h"
#include "platform/directory.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Array;
using plist::Dictionary;
using plist::Value;

constexpr const char* kRulesFile = "/etc/tarvod.d/rules/test.plist";

class CriteriaTest : public ::testing::Test {
 protected:
  void SetUp() override {
    BuildKeywordTables();
    SetDebugLevel(2);
    auto store = std::make_shared<VariableStore>();
    store->set(kGlobalsKey, Dictionary{{"count", Value::Integer(5)}});
    store->set(kRulesFile, Dictionary{{"count", Value::Integer(5)},
                                      {"zero", Value::Integer(0)},
                                      {"name", Value("total")},
                                      {"total", Value("")},
                                      {"list", Value(Array{Value("a")})}});
    context_ = std::make_unique<Context>(store, std::make_shared<Rulebase>());
    rule_ = Dictionary{{"filePath", kRulesFile}};
  }
  std::string Log() const { return capture_.text(); }
  bool Check(const char* op, Array operands) {
    return ProcessCriteria(Dictionary{{"operator", op}, {"operands", Value(std::move(operands))}},
                           rule_, *context_);
  }
  testing::LogCapture capture_;
  std::unique_ptr<Context> context_;
  Dictionary rule_;
};

struct Case {
  const char* op;
  Array operands;
  bool passes;
};

TEST_F(CriteriaTest, OperatorsFollowTheValueRulesAndTheHostsGroups) {
  const Case cases[] = {
      // A whole-reference operand keeps its kind: the number 5 is not the text 5.
      {"equal", {"${count}", "5"}, false},
      {"notequal", {"${count}", "5"}, true},
      {"greaterthanequal", {"${count}", "5"}, true},
      {"equal", {"${count}", "${global:count}"}, true},
      {"equal", {"abc", "abc"}, true},
      {"equal", {"abc", "ABC"}, false},
      // Numbers by value, strings by character.
      {"greaterthan", {"10", "9"}, true},
      {"lessthan", {"12abc", "13"}, true},
      {"lessthanequal", {"abc", "0"}, true},
      {"sortsafter", {"10", "9"}, false},
      {"sortsbefore", {"10", "9"}, true},
      {"sortsbefore", {"a", "a"}, false},
      {"sortsafter", {"a", "a"}, false},
      {"sortsbefore", {"Z", "a"}, true},  // case-sensitive, by code point
      {"sortsbefore", {"z", "\xc3\xa9"}, true},
      {"sortsafter", {"${count}", "${zero}"}, true},
      {"EndsWith", {"auth.failure", "failure"}, true},
      {"beginswith", {"auth.failure", "auth."}, true},
      {"beginswith", {"auth.failure", "Auth."}, false},
      {"contains", {"a.b.c", ".b."}, true},
      {"contains", {"a.b.c", "B"}, false},
      {"notcontains", {"a.b.c", "B"}, true},
      {"empty", {""}, true},
      {"empty", {"0"}, true},
      {"empty", {"abc"}, true},
      {"empty", {"${zero}"}, true},
      {"empty", {"7"}, false},
      {"empty", {" 7"}, false},
      {"notempty", {"7"}, true},
      {"notempty", {""}, false},
      {"defined", {"global:count"}, true},
      {"defined", {"${name}"}, true},  // tests the variable "total", whose value is ""
      {"notdefined", {"nothing"}, true},
      // One operand: "equal" compares against nothing and fails, "notequal" passes.
      {"equal", {"x"}, false},
      {"notequal", {"x"}, true},
      // Further operands are ignored.
      {"equal", {"x", "x", "y"}, true},
      // Open cases fail in plain and negated form alike.
      {"contains", {"${list}", "a"}, false},
      {"notcontains", {"${list}", "a"}, false},
      {"empty", {"${list}"}, false},
      {"notempty", {"${list}"}, false},
      {"greaterthan", {"${list}", "0"}, false},
      {"lessthanequal", {"${list}", "0"}, false},
      {"sortsbefore", {"abc", "${count}"}, false},
      {"sortsafter", {"abc", "${count}"}, false},
      {"beginswith", {"abc"}, false},
      {"sortsbefore", {"abc"}, false},
      {"groupmember", {"root"}, false},
      {"notgroupmember", {"root"}, false},
      // Group membership asks the host's directory.
      {"groupmember", {"root", "root"}, true},
      {"groupmember", {"daemon", "daemon"}, true},
      {"groupmember", {"daemon", "root"}, false},
      {"notgroupmember", {"daemon", "root"}, true},
      {"groupmember", {"bin", "sys"}, false},
      {"groupmember", {"no-such-user-here", "root"}, false},
      {"notgroupmember", {"no-such-user-here", "root"}, true},
      {"notgroupmember", {"root", "no-such-group-here"}, true},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(Check(c.op, c.operands), c.passes) << c.op << " " << Describe(Value(c.operands));
  }
  EXPECT_TRUE(IsUserInGroup("bin", "bin"));
  EXPECT_FALSE(IsUserInGroup("", "root"));
  const auto root = LookUpUser("root");
  ASSERT_TRUE(root);
  EXPECT_EQ(root->uid, 0u);
  EXPECT_EQ(GroupsOfUser(*root).front(), 0u);
  EXPECT_EQ(LookUpGroupID("adm"), std::optional<gid_t>(4));
}

TEST_F(CriteriaTest, UnknownOperatorsLogTheWholeEntryAndFail) {
  const Dictionary entry{{"operator", "ends-with"}, {"operands", Value(Array{"ab", "b"})}};
  EXPECT_FALSE(ProcessCriteria(entry, rule_, *context_));
  EXPECT_FALSE(ProcessCriteria(Dictionary{{"operands", Value(Array{"a"})}}, rule_, *context_));
  EXPECT_EQ(Log(), "The operator ends-with is invalid in the criteria:\n" + Describe(entry) +
                       "\nThe operator (null) is invalid in the criteria:\n" +
                       Describe(Dictionary{{"operands", Value(Array{"a"})}}) + "\n");
}

TEST_F(CriteriaTest, DroppedOperandsLeaveNothingToTest) {
  SetDebugLevel(0);  // only the level-0 messages
  EXPECT_FALSE(Check("empty", {"${undefined}"}));
  EXPECT_FALSE(Check("notempty", {"${undefined}"}));
  EXPECT_FALSE(ProcessCriteria(Dictionary{{"operator", "Equal"}}, rule_, *context_));
  EXPECT_EQ(Log(),
            "Error: Criteria failed because it has no operands for operator empty\n"
            "Error: Criteria failed because it has no operands for operator notempty\n"
            "Error: Criteria failed because it has no operands for operator equal\n");
}

TEST_F(CriteriaTest, LogsTheOperandsItComparesAndTrueLooksAtNone) {
  EXPECT_TRUE(Check("TRUE", {"${undefined}", "${also:undefined}"}));
  Check("equal", {"${count}", "5"});
  Check("equal", {"x"});
  Check("empty", {"7"});
  EXPECT_EQ(Log(),
            "    Evaluating always-true criteria\n"
            "    Evaluating criteria: 5 equal 5\n"
            "    Evaluating criteria: x equal\n"
            "    Evaluating criteria: x equal (null)\n"
            "    Evaluating criteria: 7 empty\n");
}

}  // namespace
}  // namespace tarvod
