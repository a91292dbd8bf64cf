#include "engine/rules_check.h"

#include <algorithm>
#include <array>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>

#include "context/format_suffix.h"
#include "engine/keyword_tables.h"

namespace tarvod {
namespace {

using Names = std::span<const std::string_view>;
using Severity = Problem::Severity;

constexpr std::array<std::string_view, 10> kRuleKeys = {"name",
                                                        "enabled",
                                                        "eventTypes",
                                                        "criterion",
                                                        "actions",
                                                        "variables",
                                                        "allowPartialCriterionMatch",
                                                        "loadVariablesFromFile",
                                                        "loadVariablesWithRule",
                                                        "filePath"};
constexpr std::array<std::string_view, 2> kCriterionKeys = {"operator", "operands"};
constexpr std::array<std::string_view, 19> kOperators = {
    "true",          "equal",      "greaterthan", "lessthan",       "greaterthanequal",
    "lessthanequal", "notequal",   "groupmember", "notgroupmember", "beginswith",
    "endswith",      "contains",   "notcontains", "sortsbefore",    "sortsafter",
    "defined",       "notdefined", "empty",       "notempty"};
constexpr std::array<std::string_view, 12> kActionTypes = {
    "nullaction", "log",     "sendemail",  "sendmessage", "sendqe",     "postnotification",
    "sendpage",   "sendsms", "runcommand", "addtodb",     "publishrss", "debugdump"};
constexpr std::array<std::string_view, 7> kLogKeys = {"type",     "message", "logType", "logPath",
                                                      "facility", "details", "logLevel"};
constexpr std::array<std::string_view, 11> kRunCommandKeys = {
    "type",        "command",   "arguments",  "workingDirectory",
    "environment", "stdinPath", "stdoutPath", "stderrPath",
    "user",        "group",     "timeout"};
constexpr std::array<std::string_view, 4> kPostNotificationKeys = {"type", "name", "message",
                                                                   "details"};
constexpr std::array<std::string_view, 9> kMailKeys = {
    "type",    "recipientAddresses",     "ccAddresses",      "relayHost", "adminEmail", "subject",
    "message", "localizationBundlePath", "localizationTable"};
constexpr std::array<std::string_view, 2> kDebugDumpKeys = {"type", "data"};
constexpr std::array<std::string_view, 1> kTypeOnly = {"type"};
constexpr std::array<std::string_view, 3> kDumpData = {"all", "globals", "rulebase"};
constexpr std::array<std::string_view, 8> kLogLevels = {"emergency", "alert",  "critical", "error",
                                                        "warning",   "notice", "info",     "debug"};
constexpr std::array<std::string_view, 4> kNamespaces = {"builtin", "event", "keychain", "global"};
constexpr std::array<std::string_view, 5> kBuiltins = {"now", "hostName", "hostIP", "hostIPv6",
                                                       "eventDictionary"};
// "system:memory:" keys are matched by their ending.
constexpr std::array<std::string_view, 5> kMemoryKeys = {"free", "used", "wired", "inactive",
                                                         "active"};
// The per-prefix counters every event's metadata carries ("auth.failure:eventCounter").
constexpr std::array<std::string_view, 2> kMetadataKeys = {"eventCounter", "lastEventTimestamp"};
// References open at once in the substitution; one more fails it.
constexpr size_t kMaxOpenReferences = 5;

std::string LowerCase(std::string_view text) {
  std::string lower(text);
  for (char& c : lower) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  }
  return lower;
}

bool Contains(Names names, std::string_view name) {
  return std::find(names.begin(), names.end(), name) != names.end();
}

size_t EditDistance(std::string_view a, std::string_view b) {
  std::vector<size_t> row(b.size() + 1);
  for (size_t j = 0; j <= b.size(); ++j) row[j] = j;
  for (size_t i = 1; i <= a.size(); ++i) {
    size_t diagonal = row[0];
    row[0] = i;
    for (size_t j = 1; j <= b.size(); ++j) {
      const size_t above = row[j];
      const bool same = (a[i - 1] | 0x20) == (b[j - 1] | 0x20);
      row[j] = std::min({row[j] + 1, row[j - 1] + 1, diagonal + (same ? 0 : 1)});
      diagonal = above;
    }
  }
  return row[b.size()];
}

// The kind with its article, as the problem lines say it: "an integer", "a string", "data".
std::string KindWithArticle(const plist::Value& value) {
  const std::string kind = plist::KindName(value);
  if (kind == "data") return kind;
  return (kind == "integer" || kind == "array" ? "an " : "a ") + kind;
}

// The problems of one rule, each placed at a key path under it.
class RuleChecker {
 public:
  RuleChecker(const std::string& file, size_t index, std::vector<Problem>& problems)
      : mFile(file), mIndex(index), mProblems(problems) {}

  void check(const plist::Value& element);

 private:
  void add(Severity severity, const std::string& path, const char* format, ...)
      __attribute__((format(printf, 4, 5)));
  void unknownKeys(const plist::Dictionary& dictionary, Names known, const std::string& path);
  // False (with the problem) when value is present and not of the kind wanted.
  bool expect(const plist::Value* value, bool right, const char* wanted, const std::string& path);
  void references(const plist::Value& value, const std::string& path);
  void criterion(const plist::Value& entry, const std::string& path);
  void action(const plist::Value& entry, const std::string& path);

  const std::string& mFile;
  size_t mIndex;
  std::string mName;
  std::vector<Problem>& mProblems;
};

std::string Join(const std::string& path, std::string_view key) {
  return path.empty() ? std::string(key) : path + "." + std::string(key);
}

std::string Indexed(std::string_view key, size_t index) {
  return std::string(key) + "[" + std::to_string(index) + "]";
}

void RuleChecker::add(Severity severity, const std::string& path, const char* format, ...) {
  char buffer[1024];
  va_list args;
  va_start(args, format);
  std::vsnprintf(buffer, sizeof buffer, format, args);
  va_end(args);
  mProblems.push_back(Problem{severity, mFile, mIndex, mName, path, buffer});
}

void RuleChecker::unknownKeys(const plist::Dictionary& dictionary, Names known,
                              const std::string& path) {
  for (const std::string& key : dictionary.sortedKeys()) {
    if (Contains(known, key)) continue;
    add(Severity::kError, Join(path, key), "unknown key, ignored%s",
        Suggestion(key, known).c_str());
  }
}

bool RuleChecker::expect(const plist::Value* value, bool right, const char* wanted,
                         const std::string& path) {
  if (value == nullptr || right) return true;
  add(Severity::kError, path, "must be %s, not %s", wanted, KindWithArticle(*value).c_str());
  return false;
}

void RuleChecker::references(const plist::Value& value, const std::string& path) {
  if (value.isString()) {
    for (const std::string& message : ReferenceProblems(value.string())) {
      add(Severity::kError, path, "%s", message.c_str());
    }
  } else if (value.isArray()) {
    size_t i = 0;
    for (const plist::Value& element : value.array()) references(element, Indexed(path, ++i));
  } else if (value.isDictionary()) {
    for (const auto& [key, element] : value.dictionary()) references(element, Join(path, key));
  }
}

void RuleChecker::criterion(const plist::Value& entry, const std::string& path) {
  const plist::Dictionary* dictionary = entry.asDictionary();
  if (dictionary == nullptr) {
    add(Severity::kError, path, "must be a dictionary, not %s; it always fails",
        KindWithArticle(entry).c_str());
    return;
  }
  unknownKeys(*dictionary, kCriterionKeys, path);
  const plist::Value* written = dictionary->find("operator");
  if (written == nullptr) {
    add(Severity::kError, Join(path, "operator"), "missing; the criterion always fails");
    return;
  }
  if (!expect(written, written->isString(), "a string", Join(path, "operator"))) return;
  const std::string keyword = LowerCase(written->string());
  if (!OperatorCode(keyword)) {
    add(Severity::kError, Join(path, "operator"), "unknown operator \"%s\"%s",
        written->string().c_str(), Suggestion(keyword, kOperators).c_str());
    return;
  }
  if (keyword == "true") return;
  const plist::Value* operands = dictionary->find("operands");
  if (!expect(operands, operands == nullptr || operands->isArray(), "an array",
              Join(path, "operands"))) {
    return;
  }
  if (operands == nullptr || operands->array().empty()) {
    add(Severity::kError, Join(path, "operands"),
        "no operands for operator \"%s\"; the criterion always fails", keyword.c_str());
    return;
  }
  references(*operands, Join(path, "operands"));
  // A number never equals a text: "${count}" holding 5 is not equal to "5".
  const plist::Array& list = operands->array();
  if ((keyword == "equal" || keyword == "notequal") && list.size() > 1) {
    for (size_t i = 0; i < 2; ++i) {
      const plist::Value& other = list[1 - i];
      const bool isReference =
          other.isString() && other.string().starts_with("${") && other.string().ends_with("}");
      if (!list[i].isString() || !isReference || list[i].string().empty()) continue;
      const std::string& text = list[i].string();
      char* end = nullptr;
      std::strtod(text.c_str(), &end);
      if (end == text.c_str() + text.size()) {
        // Operands are substituted as text, so a literal number is a string here too; a
        // format suffix turns the variable's number into text that can be compared.
        const std::string& reference = other.string();
        const std::string asText = reference.find('%') == std::string::npos
                                       ? reference.substr(0, reference.size() - 1) + "%d}"
                                       : reference;
        add(Severity::kWarning, Indexed(Join(path, "operands"), i + 1),
            "the text \"%s\" never equals a number; when %s holds one, compare %s instead",
            text.c_str(), reference.c_str(), asText.c_str());
      }
    }
  }
}

void RuleChecker::action(const plist::Value& entry, const std::string& path) {
  const plist::Dictionary* dictionary = entry.asDictionary();
  if (dictionary == nullptr) {
    add(Severity::kError, path, "must be a dictionary, not %s; it does nothing",
        KindWithArticle(entry).c_str());
    return;
  }
  const plist::Value* type = dictionary->find("type");
  if (type == nullptr) {
    add(Severity::kError, Join(path, "type"), "missing; the action does nothing");
    return;
  }
  if (!expect(type, type->isString(), "a string", Join(path, "type"))) return;
  const std::string keyword = LowerCase(type->string());
  if (!ActionCode(keyword)) {
    add(Severity::kError, Join(path, "type"), "unknown action type \"%s\"%s; it does nothing",
        type->string().c_str(), Suggestion(keyword, kActionTypes).c_str());
    return;
  }
  Names keys = kTypeOnly;
  if (keyword == "log") keys = kLogKeys;
  if (keyword == "runcommand") keys = kRunCommandKeys;
  if (keyword == "postnotification") keys = kPostNotificationKeys;
  if (keyword == "sendemail" || keyword == "sendpage" || keyword == "sendsms") keys = kMailKeys;
  if (keyword == "debugdump") keys = kDebugDumpKeys;
  unknownKeys(*dictionary, keys, path);

  if (keyword == "log") {
    if (const plist::Value* level = dictionary->find("logLevel")) {
      if (!level->isString() || !Contains(kLogLevels, LowerCase(level->string()))) {
        const std::string shown = level->textForm();
        add(Severity::kError, Join(path, "logLevel"), "unknown log level \"%s\"%s; notice is used",
            shown.c_str(), Suggestion(LowerCase(shown), kLogLevels).c_str());
      }
    }
    const plist::Value* details = dictionary->find("details");
    expect(details, details == nullptr || details->isDictionary(), "a dictionary",
           Join(path, "details"));
    if (!dictionary->contains("message")) {
      add(Severity::kWarning, Join(path, "message"), "missing; the action logs nothing");
    }
  } else if (keyword == "runcommand") {
    const plist::Value* command = dictionary->find("command");
    if (command == nullptr) add(Severity::kError, Join(path, "command"), "missing");
    const plist::Value* arguments = dictionary->find("arguments");
    expect(arguments, arguments == nullptr || arguments->isArray(), "an array",
           Join(path, "arguments"));
    const plist::Value* environment = dictionary->find("environment");
    expect(environment, environment == nullptr || environment->isDictionary(), "a dictionary",
           Join(path, "environment"));
    for (const char* key : {"user", "group"}) {
      const plist::Value* value = dictionary->find(key);
      expect(value, value == nullptr || value->isString(), "a string", Join(path, key));
    }
  } else if (keyword == "postnotification") {
    const plist::Value* details = dictionary->find("details");
    expect(details, details == nullptr || details->isDictionary(), "a dictionary",
           Join(path, "details"));
  } else if (keyword == "debugdump") {
    const plist::Value* data = dictionary->find("data");
    if (data == nullptr || !data->isString() || !Contains(kDumpData, data->string())) {
      const std::string shown = data ? data->textForm() : "(null)";
      add(Severity::kError, Join(path, "data"), "\"%s\" dumps nothing (all, globals or rulebase)%s",
          shown.c_str(), Suggestion(shown, kDumpData).c_str());
    }
  } else if (keys.size() == 1) {
    add(Severity::kWarning, Join(path, "type"), "\"%s\" does nothing", type->string().c_str());
  }
  for (const auto& [key, value] : *dictionary) {
    // These keys are taken as written, without substitution.
    if (key == "type" || key == "user" || key == "group" || key == "facility" ||
        key == "logLevel" || key == "localizationBundlePath" || key == "localizationTable") {
      continue;
    }
    references(value, Join(path, key));
  }
}

void RuleChecker::check(const plist::Value& element) {
  const plist::Dictionary* rule = element.asDictionary();
  if (rule == nullptr) {
    add(Severity::kError, "", "must be a dictionary, not %s; skipped",
        KindWithArticle(element).c_str());
    return;
  }
  if (const plist::Value* name = rule->find("name")) mName = name->textForm();
  unknownKeys(*rule, kRuleKeys, "");

  const plist::Value* name = rule->find("name");
  expect(name, name == nullptr || name->isString(), "a string", "name");
  const plist::Value* enabled = rule->find("enabled");
  expect(enabled, enabled == nullptr || enabled->isBoolean(), "a boolean", "enabled");
  const plist::Value* partial = rule->find("allowPartialCriterionMatch");
  expect(partial, partial == nullptr || partial->isBoolean(), "a boolean",
         "allowPartialCriterionMatch");
  for (const char* key : {"loadVariablesFromFile", "loadVariablesWithRule"}) {
    const plist::Value* value = rule->find(key);
    expect(value, value == nullptr || value->isString(), "a string", key);
  }
  if (rule->contains("filePath")) {
    add(Severity::kWarning, "filePath", "set by the loader; the value written here is replaced");
  }

  const plist::Value* eventTypes = rule->find("eventTypes");
  if (eventTypes == nullptr) {
    add(Severity::kWarning, "eventTypes", "missing; the rule is skipped");
  } else if (!eventTypes->isArray()) {
    add(Severity::kError, "eventTypes", "must be an array, not %s; the rule is skipped",
        KindWithArticle(*eventTypes).c_str());
  } else if (eventTypes->array().empty()) {
    add(Severity::kWarning, "eventTypes", "empty; the rule never runs");
  } else {
    size_t i = 0;
    for (const plist::Value& type : eventTypes->array()) {
      expect(&type, type.isString(), "a string", Indexed("eventTypes", ++i));
    }
  }

  if (const plist::Value* criteria = rule->find("criterion")) {
    if (criteria->isArray()) {
      size_t i = 0;
      for (const plist::Value& entry : criteria->array())
        criterion(entry, Indexed("criterion", ++i));
    } else {
      add(Severity::kError, "criterion", "must be an array, not %s; the rule never fires",
          KindWithArticle(*criteria).c_str());
    }
  }
  if (const plist::Value* actions = rule->find("actions")) {
    if (actions->isArray()) {
      size_t i = 0;
      for (const plist::Value& entry : actions->array()) action(entry, Indexed("actions", ++i));
    } else {
      add(Severity::kError, "actions", "must be an array, not %s; no action runs",
          KindWithArticle(*actions).c_str());
    }
  }
  if (const plist::Value* variables = rule->find("variables")) {
    if (variables->isDictionary()) {
      references(*variables, "variables");
    } else {
      add(Severity::kError, "variables", "must be a dictionary, not %s; none is set",
          KindWithArticle(*variables).c_str());
    }
  }
}

// The problem of one reference's name, or "" when it can resolve.
std::string NameProblem(std::string_view reference) {
  std::string_view name = reference;
  if (const size_t percent = reference.rfind('%'); percent != std::string_view::npos) {
    name = plist::TrimSpace(reference.substr(0, percent));
    const std::string_view suffix = plist::TrimSpace(reference.substr(percent));
    if (!suffix.empty() && !IsAppliedFormatSuffix(suffix)) {
      return "format suffix \"" + std::string(suffix) + "\" of ${" + std::string(reference) +
             "} is not applied; the value is used unformatted";
    }
  }
  const size_t colon = name.find(':');
  if (colon == std::string_view::npos) return "";
  const std::string_view space = name.substr(0, colon);
  const std::string_view rest = name.substr(colon + 1);
  if (space == "event" || space == "keychain" || space == "global") return "";
  if (space == "builtin") {
    if (Contains(kBuiltins, rest) || rest.starts_with("now")) return "";
    if (rest.starts_with("system:memory:")) {
      for (const std::string_view key : kMemoryKeys) {
        if (rest.ends_with(key)) return "";
      }
    }
    return "unknown builtin variable \"" + std::string(rest) + "\"" + Suggestion(rest, kBuiltins) +
           "; it has no value";
  }
  // Any other name with a colon is a key of the event's metadata.
  const size_t last = name.rfind(':');
  if (Contains(kMetadataKeys, name.substr(last + 1))) return "";
  return "unknown namespace \"" + std::string(space) + "\" in ${" + std::string(reference) + "}" +
         Suggestion(space, kNamespaces) + "; it never has a value";
}

}  // namespace

Problem FileProblem(std::string file, std::string message, Problem::Severity severity) {
  return Problem{severity, std::move(file), 0, "", "", std::move(message)};
}

std::string FormatProblem(const Problem& problem) {
  std::string text = problem.file;
  if (problem.rule != 0) {
    text += ": rule " + std::to_string(problem.rule);
    if (!problem.ruleName.empty()) text += " \"" + problem.ruleName + "\"";
  }
  if (!problem.keyPath.empty()) text += ": " + problem.keyPath;
  text += ": ";
  if (problem.severity == Severity::kWarning) text += "warning: ";
  return text + problem.message;
}

size_t LoadReport::count(Problem::Severity severity) const {
  return static_cast<size_t>(std::count_if(
      problems.begin(), problems.end(), [&](const Problem& p) { return p.severity == severity; }));
}

void CheckRule(const plist::Value& element, const std::string& file, size_t index,
               std::vector<Problem>& problems) {
  RuleChecker(file, index, problems).check(element);
}

std::vector<std::string> ReferenceProblems(std::string_view text) {
  // The same scan as the substitution: a backslash escapes the next "$" or "}", a "}" closes
  // the innermost open reference, and a nested reference becomes part of the outer name.
  std::vector<std::string> problems;
  std::vector<size_t> open;
  bool escaped = false;
  for (size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    if (c == '$' && !escaped && i + 1 < text.size() && text[i + 1] == '{') {
      if (open.size() == kMaxOpenReferences) {
        problems.push_back("more than " + std::to_string(kMaxOpenReferences) +
                           " references nested in one another; the substitution fails");
        return problems;
      }
      open.push_back(i);
      ++i;
      continue;
    }
    if (c == '\\') {
      escaped = !escaped;
      continue;
    }
    if (c == '}' && !escaped && !open.empty()) {
      const size_t start = open.back();
      open.pop_back();
      const std::string_view name = text.substr(start + 2, i - start - 2);
      // A name built from another reference is known only when the rule runs.
      if (name.find("${") == std::string_view::npos) {
        if (std::string problem = NameProblem(name); !problem.empty()) {
          problems.push_back(std::move(problem));
        }
      }
    }
    escaped = false;
  }
  for (const size_t start : open) {
    problems.push_back("unterminated \"${\" at index " + std::to_string(start) +
                       "; the substitution fails");
  }
  return problems;
}

std::optional<std::string_view> NearestName(std::string_view word, Names candidates) {
  std::optional<std::string_view> best;
  size_t bestDistance = 0;
  for (const std::string_view candidate : candidates) {
    const size_t distance = EditDistance(word, candidate);
    if (!best || distance < bestDistance) {
      best = candidate;
      bestDistance = distance;
    }
  }
  // Near: at most a third of the longer name's letters changed, and at least one allowed.
  if (!best || bestDistance > std::max<size_t>(1, std::max(word.size(), best->size()) / 3)) {
    return std::nullopt;
  }
  return best;
}

std::string Suggestion(std::string_view word, Names candidates) {
  const std::optional<std::string_view> nearest = NearestName(word, candidates);
  if (!nearest) return "";
  return " (did you mean \"" + std::string(*nearest) + "\"?)";
}

}  // namespace tarvod
