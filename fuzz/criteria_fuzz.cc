// Criteria: criterion dictionaries built from the fuzzer's bytes (a known or made-up operator,
// operands of every kind, variable references among them) evaluated in a context with
// variables, as a rule's criteria array is.
#include <fcntl.h>

#include <cstddef>
#include <cstdint>
#include <memory>

#include "engine/keyword_tables.h"
#include "engine/rule_processor.h"
#include "fuzz_input.h"
#include "platform/diagnostic_log.h"

namespace {

constexpr const char* kRulesFile = "/etc/tarvod.d/rules/fuzz.plist";

bool Setup() {
  tarvod::BuildKeywordTables();
  // Every message is formatted and written, to /dev/null.
  const int fd = open("/dev/null", O_WRONLY | O_APPEND | O_CLOEXEC);
  if (fd >= 0) tarvod::AttachErrorLog(fd);
  tarvod::SetDebugLevel(3);
  return true;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const bool ready = Setup();
  (void)ready;
  using plist::Value;
  auto store = std::make_shared<tarvod::VariableStore>();
  store->set(tarvod::kGlobalsKey, plist::Dictionary{{"count", Value::Integer(5)}});
  store->set(kRulesFile, plist::Dictionary{{"count", Value::Integer(3)},
                                           {"name", "count"},
                                           {"list", Value(plist::Array{"a"})}});
  tarvod::Context context(
      store, std::make_shared<tarvod::Rulebase>(),
      plist::Dictionary{{"eventType", "t"}, {"eventDetails", plist::Dictionary{{"user", "root"}}}});
  const tarvod::Rule rule{{"filePath", kRulesFile}};
  tarvod::fuzz::ByteReader in(data, size);
  while (!in.empty()) {
    plist::Dictionary criterion;
    criterion.set("operator",
                  in.pick({"true", "equal", "greaterThan", "lessThan", "greaterThanEqual",
                           "lessThanEqual", "notEqual", "groupMember", "notGroupMember",
                           "beginsWith", "endsWith", "contains", "notContains", "sortsBefore",
                           "sortsAfter", "defined", "notDefined", "empty", "notEmpty"}));
    if (in.byte() % 8 != 0) {
      plist::Array operands;
      for (size_t n = in.byte() % 4; n > 0; --n) operands.push_back(tarvod::fuzz::BuildValue(in));
      criterion.set("operands", Value(std::move(operands)));
    } else {
      criterion.set("operands", tarvod::fuzz::BuildValue(in));  // not an array
    }
    tarvod::ProcessCriteria(criterion, rule, context);
  }
  return 0;
}
