// Substitution of "${name}" references in strings, arrays, dictionaries and any value.
//
// A string is scanned once, left to right. The text scanned so far is kept in an output buffer
// in which each reference is replaced when its closing brace is met; the rest of the input is
// still to come. The working copy of the text is therefore the buffer followed by the unscanned
// input, inserted text is never scanned again, and a nested reference's value simply becomes
// part of the enclosing reference's name in the buffer. Every byte is copied a bounded number
// of times (at most once per open reference), so the cost is linear in the input.

#include <initializer_list>
#include <vector>

#include "context/context.h"
#include "platform/diagnostic_log.h"

namespace tarvod {
namespace {

// References open at once; one more is the nesting error.
constexpr size_t kMaxOpenReferences = 5;
// Arrays and dictionaries nested inside one another. The property-list readers refuse deeper
// values, so only a value built in memory can reach it; the bound keeps the recursion off the
// end of the stack.
constexpr int kMaxCollectionDepth = 256;

// The daemon's localized-string lookup of a message text: no translation tables ship, so
// every text is its own translation.
std::string_view LocalizedString(std::string_view text) { return text; }

// Fills "%lu" and "%@" placeholders in order with the given texts (the argument may be of any
// length, so this does not go through a bounded formatter).
std::string FillPlaceholders(std::string_view format,
                             std::initializer_list<std::string_view> args) {
  std::string result;
  auto next = args.begin();
  for (size_t i = 0; i < format.size(); ++i) {
    if (format[i] == '%' && next != args.end()) {
      const std::string_view rest = format.substr(i + 1);
      const size_t width = rest.starts_with("lu") ? 2 : rest.starts_with("@") ? 1 : 0;
      if (width > 0) {
        result += *next++;
        i += width;
        continue;
      }
    }
    result.push_back(format[i]);
  }
  return result;
}

// Positions are reported in UTF-16 code units: one per UTF-8 sequence, two for a sequence of
// four bytes (a character outside the basic plane).
unsigned long Utf16Length(std::string_view text) {
  unsigned long units = 0;
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if ((byte & 0xC0) != 0x80) ++units;
    if (byte >= 0xF0) ++units;
  }
  return units;
}

std::string JoinLines(const std::vector<std::string>& lines) {
  std::string joined;
  for (const std::string& line : lines) {
    if (!joined.empty()) joined.push_back('\n');
    joined += line;
  }
  return joined;
}

SubstitutionError DepthError() {
  return SubstitutionError{
      .description = FillPlaceholders(
          LocalizedString("Value exceeded the maximum allowable levels of nesting (%lu)"),
          {std::to_string(kMaxCollectionDepth)})};
}

// Counts one level of array or dictionary for as long as it lives.
class DepthGuard {
 public:
  explicit DepthGuard(int& depth) : mDepth(depth) { ++mDepth; }
  ~DepthGuard() { --mDepth; }
  DepthGuard(const DepthGuard&) = delete;
  DepthGuard& operator=(const DepthGuard&) = delete;

 private:
  int& mDepth;
};

}  // namespace

std::optional<plist::Value> Context::resolveVariablesInString(const std::string& text,
                                                              std::string_view rulesFile,
                                                              ErrorSlot* error) {
  // The shortest reference, "${}", has three characters.
  // Without "${" nothing opens, so the text comes back as it is.
  if (text.size() < 3 || text.find("${") == std::string::npos) return plist::Value(text);

  std::string out;
  out.reserve(text.size());
  size_t open[kMaxOpenReferences];  // positions in out of the open references' "$"
  size_t openCount = 0;
  std::vector<std::string> errors;
  bool escaped = false;
  const size_t n = text.size();
  size_t i = 0;
  while (i < n) {
    const char c = text[i];
    if (c == '$' && !escaped && i + 1 < n && text[i + 1] == '{') {
      if (openCount == kMaxOpenReferences) {
        errors.push_back(FillPlaceholders(
            LocalizedString(
                "String exceeded the maximum allowable levels of variable nesting (%lu): %@"),
            {std::to_string(kMaxOpenReferences), text}));
        break;  // the scan stops at the first error
      }
      open[openCount++] = out.size();
      out.append("${");
      i += 2;
      continue;
    }
    if (c == '\\') {
      escaped = !escaped;
      out.push_back(c);
      ++i;
      continue;
    }
    if (c == '}' && !escaped && openCount > 0) {
      const size_t start = open[--openCount];
      const std::string name = out.substr(start + 2);
      if (DebugLevel() >= 4) LogMessage(4, "tokenName is %s", shownText(name).c_str());
      std::optional<plist::Value> value = variableValueForKey(name, rulesFile);
      // The whole text is this one reference: its value itself, of whatever kind, or nothing.
      if (start == 0 && i == n - 1) return value;
      out.resize(start);
      if (const std::string* string = value ? value->asString() : nullptr) {
        if (DebugLevel() >= 4) LogMessage(4, "tokenValue is %s", shownText(*string).c_str());
        out += *string;
      } else if (value) {
        const std::string inserted = value->textForm();
        if (DebugLevel() >= 4) LogMessage(4, "tokenValue is %s", shownText(inserted).c_str());
        out += inserted;
      } else {
        LogMessage(4, "tokenValue is %s", "(null)");
        out.push_back('0');  // a variable without a value reads as 0 inside text
      }
      escaped = false;
      ++i;
      continue;
    }
    // Plain text up to the next character that may matter, copied in one step.
    size_t next = text.find_first_of("$\\}", i + 1);
    if (next == std::string::npos) next = n;
    out.append(text, i, next - i);
    escaped = false;
    i = next;
  }

  // Innermost first.
  while (openCount > 0) {
    const size_t start = open[--openCount];
    errors.push_back(FillPlaceholders(
        LocalizedString("Unterminated token starting at index %lu in string: %@"),
        {std::to_string(Utf16Length(std::string_view(out).substr(0, start))), text}));
  }
  if (errors.empty()) return plist::Value(std::move(out));

  // The description is logged by every caller; a secret inserted before the failure must not
  // travel in it.
  std::string description = shownText(JoinLines(errors));
  LogMessage(2, "Errors occurred resolving variables in string %s:\n%s", shownText(text).c_str(),
             description.c_str());
  if (error != nullptr) *error = SubstitutionError{.description = std::move(description)};
  return std::nullopt;
}

std::optional<plist::Value> Context::resolveVariablesInArray(const plist::Array& array,
                                                             std::string_view rulesFile,
                                                             ErrorSlot* error) {
  if (array.empty()) return plist::Value(array);
  // Without a caller's slot, a failing element is still noticed here.
  ErrorSlot local;
  ErrorSlot* slot = error != nullptr ? error : &local;
  if (mResolveDepth >= kMaxCollectionDepth) {
    *slot = DepthError();
    return std::nullopt;
  }
  DepthGuard guard(mResolveDepth);

  plist::Array resolved;
  resolved.reserve(array.size());
  for (const plist::Value& element : array) {
    std::optional<plist::Value> value = resolveVariablesInObject(element, rulesFile, slot);
    if (!value) {
      if (DebugLevel() >= 1) {
        LogMessage(1, "The array object %s could not be resolved and was omitted.",
                   shownValue(element).c_str());
      }
      continue;
    }
    if (*slot) {
      LogMessage(0, "Error: %s", (*slot)->description.c_str());
      return std::nullopt;
    }
    resolved.push_back(std::move(*value));
  }
  return plist::Value(std::move(resolved));
}

std::optional<plist::Value> Context::resolveVariablesInDictionary(
    const plist::Dictionary& dictionary, std::string_view rulesFile, ErrorSlot* error) {
  if (dictionary.empty()) return std::nullopt;
  ErrorSlot local;
  ErrorSlot* slot = error != nullptr ? error : &local;
  if (mResolveDepth >= kMaxCollectionDepth) {
    *slot = DepthError();
    return std::nullopt;
  }
  DepthGuard guard(mResolveDepth);

  std::vector<plist::Dictionary::Entry> entries;
  entries.reserve(dictionary.size());
  for (const auto& [key, value] : dictionary) {
    std::optional<plist::Value> resolvedValue = resolveVariablesInObject(value, rulesFile, slot);
    if (!resolvedValue) {
      LogMessage(0, "The dictionary value %s could not be resolved", shownValue(value).c_str());
    }
    if (*slot) {
      LogMessage(0, "Error: %s", (*slot)->description.c_str());
      return std::nullopt;
    }
    std::optional<plist::Value> resolvedKey = resolveVariablesInString(key, rulesFile, slot);
    if (!resolvedKey) {
      std::string message = FillPlaceholders(
          LocalizedString("The dictionary key %@ could not be resolved"), {shownText(key)});
      LogMessage(0, "%s", message.c_str());
      *slot = SubstitutionError{.description = std::move(message)};
      return std::nullopt;
    }
    if (*slot) {
      LogMessage(0, "Error: %s", (*slot)->description.c_str());
      return std::nullopt;
    }
    if (!resolvedValue) continue;
    // A key that was one whole reference to a non-string value is keyed by its text form.
    std::string newKey = resolvedKey->textForm();
    entries.emplace_back(std::move(newKey), std::move(*resolvedValue));
  }
  // Two keys that resolve alike keep the later value, in the place of the first.
  return plist::Value(plist::Dictionary::FromEntries(std::move(entries)));
}

std::optional<plist::Value> Context::resolveVariablesInObject(const plist::Value& value,
                                                              std::string_view rulesFile,
                                                              ErrorSlot* error) {
  if (const plist::Array* array = value.asArray()) {
    return resolveVariablesInArray(*array, rulesFile, error);
  }
  if (const plist::Dictionary* dictionary = value.asDictionary()) {
    return resolveVariablesInDictionary(*dictionary, rulesFile, error);
  }
  // Numbers, booleans, dates and data come back as the substitution of their text form.
  if (const std::string* text = value.asString()) {
    return resolveVariablesInString(*text, rulesFile, error);
  }
  return resolveVariablesInString(value.textForm(), rulesFile, error);
}

}  // namespace tarvod
