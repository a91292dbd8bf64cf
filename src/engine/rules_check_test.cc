#include "engine/rules_check.h"

#include <gtest/gtest.h>

#include "plist/codec.h"

namespace tarvod {
namespace {

// The report lines of one rule (element 3 of rules/ssh.plist), written in the text form.
std::vector<std::string> Lines(std::string_view rule) {
  const std::optional<plist::Value> element = plist::ReadPropertyList(rule);
  EXPECT_TRUE(element) << rule;
  std::vector<Problem> problems;
  if (element) CheckRule(*element, "rules/ssh.plist", 3, problems);
  std::vector<std::string> lines;
  for (const Problem& problem : problems) lines.push_back(FormatProblem(problem));
  return lines;
}

TEST(RulesCheck, ReportsEachMistakeWithFileRuleAndKeyPath) {
  const std::string prefix = "rules/ssh.plist: rule 3 \"ban\": ";
  const struct {
    const char* rule;
    const char* line;
  } kCases[] = {
      {R"({name = ban; eventType = (a);})",
       R"(eventType: unknown key, ignored (did you mean "eventTypes"?))"},
      {R"({name = ban; eventTypes = a;})",
       "eventTypes: must be an array, not a string; the rule is skipped"},
      {R"({name = ban; eventTypes = (a); actions = {type = log;};})",
       "actions: must be an array, not a dictionary; no action runs"},
      {R"({name = ban; eventTypes = (a); actions = ({type = ban; message = x;});})",
       R"(actions[1].type: unknown action type "ban"; it does nothing)"},
      {R"({name = ban; eventTypes = (a); actions = ({type = log; mesage = x; message = y;});})",
       R"(actions[1].mesage: unknown key, ignored (did you mean "message"?))"},
      {R"({name = ban; eventTypes = (a); actions = ({type = log; message = x; logLevel = warnig;});})",
       R"(actions[1].logLevel: unknown log level "warnig" (did you mean "warning"?); notice is used)"},
      {R"({name = ban; eventTypes = (a); criterion = ({operator = equals; operands = (1, 2);});})",
       R"(criterion[1].operator: unknown operator "equals" (did you mean "equal"?))"},
      {R"({name = ban; eventTypes = (a); criterion = ({operator = equal;});})",
       R"(criterion[1].operands: no operands for operator "equal"; the criterion always fails)"},
      {R"({name = ban; eventTypes = (a); criterion = ({operator = equal; operands = ("${count}", "5");});})",
       "criterion[1].operands[2]: warning: the text \"5\" never equals a number; when ${count} "
       "holds one, compare ${count%d} instead"},
      {R"({name = ban; eventTypes = (a); variables = {x = "${a";};})",
       R"(variables.x: unterminated "${" at index 0; the substitution fails)"},
      {R"({name = ban; eventTypes = (a); variables = {x = "${globl:a}";};})",
       R"(variables.x: unknown namespace "globl" in ${globl:a} (did you mean "global"?); it never has a value)"},
      {R"({name = ban; eventTypes = (a); variables = {x = "${builtin:hostname}";};})",
       R"(variables.x: unknown builtin variable "hostname" (did you mean "hostName"?); it has no value)"},
      {R"({name = ban; eventTypes = (a); variables = {x = "${a %n}";};})",
       R"(variables.x: format suffix "%n" of ${a %n} is not applied; the value is used unformatted)"},
      {R"({name = ban; eventTypes = (a); actions = ({type = debugdump; data = All;});})",
       R"(actions[1].data: "All" dumps nothing (all, globals or rulebase) (did you mean "all"?))"},
      {R"({name = ban; eventTypes = ();})", "eventTypes: warning: empty; the rule never runs"},
      {R"({name = ban;})", "eventTypes: warning: missing; the rule is skipped"},
  };
  for (const auto& c : kCases) {
    const std::vector<std::string> lines = Lines(c.rule);
    ASSERT_FALSE(lines.empty()) << c.rule;
    EXPECT_EQ(lines.front(), prefix + c.line) << c.rule;
  }
  // Misspelt, eventTypes is also missing: both are reported, the misspelling first.
  EXPECT_EQ(Lines(R"({name = ban; eventType = (a);})").size(), 2u);
  EXPECT_EQ(Lines("(a)"),
            std::vector<std::string>{"rules/ssh.plist: rule 3: must be a dictionary, not an array; "
                                     "skipped"});
}

TEST(RulesCheck, FindsNothingInSoundRules) {
  EXPECT_TRUE(Lines(R"({name = ok; eventTypes = (auth.failure); 
      criterion = ({operator = Equal; operands = ("${event:user}", root);},
                   {operator = greaterthan; operands = ("${auth.failure:eventCounter}", 4);});
      variables = {last = "${builtin:now} ${builtin:system:memory:free%m} ${global:x%5.1f} \\${y";};
      actions = ({type = runcommand; command = /bin/true; arguments = ("${event:address}");
                  user = nobody;},
                 {type = LOG; message = "${keychain:s/a}"; logLevel = Error; logType = syslog;});})")
                  .empty());
}

TEST(RulesCheck, SuggestsOnlyNearNames) {
  const std::string_view names[] = {"criterion", "actions", "log"};
  EXPECT_EQ(NearestName("critera", names), "criterion");
  EXPECT_EQ(NearestName("Actions", names), "actions");
  EXPECT_EQ(NearestName("foo", names), std::nullopt);
  EXPECT_EQ(NearestName("comment", names), std::nullopt);
}

}  // namespace
}  // namespace tarvod
