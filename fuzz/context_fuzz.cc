// Variable lookup, existence, assignment and substitution on fuzzer-chosen text. Each line of
// the input is one operation, chosen by its first character:
//   L name        look the name up           E name        test whether it exists
//   S text        substitute ${...} in text  A name=value  assign (arithmetic applies)
// over a store with globals and file-local variables and an event, so that every namespace,
// format suffix and the arithmetic rule are reachable.
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string_view>

#include "context/context.h"
#include "fuzz_input.h"

namespace {

constexpr std::string_view kRulesFile = "/etc/tarvod.d/rules/fuzz.plist";

tarvod::VariableStorePtr MakeStore() {
  auto store = std::make_shared<tarvod::VariableStore>();
  store->set(tarvod::kGlobalsKey, plist::Dictionary{{"count", plist::Value::Integer(5)},
                                                    {"ratio", plist::Value::Real(0.25)}});
  store->set(std::string(kRulesFile),
             plist::Dictionary{{"count", plist::Value::Integer(3)},
                               {"name", "count"},
                               {"when", plist::Value::FromDate(plist::Date{7e8})},
                               {"list", plist::Value(plist::Array{"a", plist::Value::Integer(1)})},
                               {"blob", plist::Value::FromData({0, 1, 2})}});
  return store;
}

const plist::Dictionary kEvent{
    {"eventType", "t"},
    {"eventDetails", plist::Dictionary{{"user", "alice"}, {"path", "/a:b\\:c"}}}};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  tarvod::Context context(MakeStore(), std::make_shared<tarvod::Rulebase>(), kEvent);
  std::string_view input(reinterpret_cast<const char*>(data), size);
  while (!input.empty()) {
    const size_t end = input.find('\n');
    const std::string_view line = input.substr(0, end);
    input.remove_prefix(end == std::string_view::npos ? input.size() : end + 1);
    if (line.empty()) continue;
    const std::string_view operand = line.substr(1);
    switch (line[0]) {
      case 'L':
        context.variableValueForKey(operand, kRulesFile);
        break;
      case 'E':
        context.keyExists(operand, kRulesFile);
        break;
      case 'A': {
        const size_t equals = operand.find('=');
        const std::string_view name = operand.substr(0, equals);
        const std::string_view value =
            equals == std::string_view::npos ? std::string_view() : operand.substr(equals + 1);
        context.setVariableValue(plist::Value(value), name, kRulesFile);
        break;
      }
      default: {
        tarvod::ErrorSlot error;
        context.resolveVariablesInString(std::string(operand), kRulesFile, &error);
      }
    }
  }
  return 0;
}
