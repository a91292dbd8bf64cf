// The Context object: construction, event import, the statistics snapshot, the colon-escape
// convention and the description printed in messages.

#include "context/context.h"

#include <vector>

#include "platform/diagnostic_log.h"

namespace tarvod {
namespace {

constexpr std::string_view kEventDetailsKey = "eventDetails";

// Scans text with the escape convention and calls visit(position, escaped) for every colon.
// A backslash toggles the flag; every other character is examined with the flag as it stands
// and then clears it. visit returns false to stop the scan early.
template <typename Visit>
void ForEachColon(std::string_view text, Visit visit) {
  bool escaped = false;
  for (size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    if (c == '\\') {
      escaped = !escaped;
      continue;
    }
    if (c == ':' && !visit(i, escaped)) return;
    escaped = false;
  }
}

plist::Dictionary MaskedDictionary(const Keychain& keychain, const plist::Dictionary& dictionary);

// A copy of value with every secret text in its strings (and dictionary keys) masked.
plist::Value MaskedValue(const Keychain& keychain, const plist::Value& value) {
  if (const std::string* text = value.asString()) return plist::Value(keychain.mask(*text));
  if (const plist::Dictionary* dictionary = value.asDictionary()) {
    return plist::Value(MaskedDictionary(keychain, *dictionary));
  }
  if (const plist::Array* array = value.asArray()) {
    plist::Array masked;
    masked.reserve(array->size());
    for (const plist::Value& element : *array) masked.push_back(MaskedValue(keychain, element));
    return plist::Value(std::move(masked));
  }
  // A number computed from a secret is shown as the placeholder, as a string.
  if (!value.isData() && keychain.isSecret(value)) {
    return plist::Value(keychain.mask(value.textForm()));
  }
  return value;
}

plist::Dictionary MaskedDictionary(const Keychain& keychain, const plist::Dictionary& dictionary) {
  std::vector<plist::Dictionary::Entry> entries;
  entries.reserve(dictionary.size());
  for (const auto& [key, value] : dictionary) {
    entries.emplace_back(keychain.mask(key), MaskedValue(keychain, value));
  }
  return plist::Dictionary::FromEntries(std::move(entries));
}

}  // namespace

std::string EscapeColonsInEventString(std::string_view text) {
  std::string result;
  result.reserve(text.size() + 8);
  size_t copied = 0;
  ForEachColon(text, [&](size_t position, bool escaped) {
    if (!escaped) {
      result.append(text, copied, position - copied);
      result.push_back('\\');
      copied = position;
    }
    return true;
  });
  result.append(text, copied, std::string_view::npos);
  return result;
}

std::string UnescapeColonsInString(std::string_view text) {
  std::string result;
  result.reserve(text.size());
  size_t copied = 0;
  ForEachColon(text, [&](size_t position, bool escaped) {
    if (escaped) {
      // Drop the one backslash right before the colon; the rest of its run stays.
      result.append(text, copied, position - 1 - copied);
      copied = position;
    }
    return true;
  });
  result.append(text, copied, std::string_view::npos);
  return result;
}

bool UnescapedColonsInString(std::string_view text) {
  bool found = false;
  ForEachColon(text, [&](size_t, bool escaped) {
    found = !escaped;
    return !found;
  });
  return found;
}

Context::Context(VariableStorePtr variables, RulebasePtr rulebase,
                 std::shared_ptr<Keychain> keychain)
    : mVariables(std::move(variables)),
      mRulebase(std::move(rulebase)),
      mKeychain(std::move(keychain)) {}

Context::Context(VariableStorePtr variables, RulebasePtr rulebase, const plist::Dictionary& event,
                 std::shared_ptr<Keychain> keychain)
    : Context(std::move(variables), std::move(rulebase), std::move(keychain)) {
  setEvent(event);
}

Context::~Context() = default;

void Context::setEvent(const plist::Dictionary& event) {
  std::vector<plist::Dictionary::Entry> entries;
  const plist::Dictionary* details = event.findDictionary(kEventDetailsKey);
  entries.reserve(event.size() + (details ? details->size() : 0));
  if (details != nullptr) {
    // Details come from the event's sender: their colons are escaped so that a value such as
    // "12:30" cannot pass for a namespace or metadata reference once substituted into a name.
    for (const auto& [key, value] : *details) {
      const std::string* text = value.asString();
      if (text == nullptr) {
        entries.emplace_back(key, value);
        continue;
      }
      LogMessage(4, "key = %s before escape %s", key.c_str(), text->c_str());
      std::string escaped = EscapeColonsInEventString(*text);
      LogMessage(4, "after escape %s", escaped.c_str());
      entries.emplace_back(key, plist::Value(std::move(escaped)));
    }
  }
  // The top-level entries (eventType, eventSource, ...) replace details of the same name.
  for (const auto& [key, value] : event) {
    if (key != kEventDetailsKey) entries.emplace_back(key, value);
  }
  // FromEntries keeps the replacement linear however many keys a sender puts in an event.
  mEvent = plist::Dictionary::FromEntries(std::move(entries));
}

const StatContext* Context::stats() {
  // Taken on first use rather than at construction: events whose rules read no "system:"
  // value pay nothing, and every later read through this context sees the same moment.
  if (!mStatsTaken) {
    mStats = CreateStatContext();
    mStatsTaken = true;
  }
  return mStats.get();
}

std::string Context::shownText(std::string_view text) const {
  if (!mKeychain) return std::string(text);
  return mKeychain->mask(text);
}

std::string Context::shownValue(const plist::Value& value) const {
  if (!mKeychain || !mKeychain->hasSecrets()) return value.textForm();
  // Masked before the text form is made: the old-style form quotes and escapes strings, and
  // an escaped secret would no longer be found in it.
  return MaskedValue(*mKeychain, value).textForm();
}

std::string Context::shownValue(const std::optional<plist::Value>& value) const {
  return value ? shownValue(*value) : "(null)";
}

std::string Context::variablesDescription() const {
  if (!mVariables) return "(null)";
  if (!mKeychain || !mKeychain->hasSecrets()) return plist::Describe(*mVariables);
  return plist::Describe(MaskedDictionary(*mKeychain, *mVariables));
}

std::string Context::description() const {
  const std::string event = mEvent ? plist::Describe(*mEvent) : "(null)";
  const std::string variables = variablesDescription();
  const std::string rulebase = mRulebase ? plist::Describe(RulebaseToValue(*mRulebase)) : "(null)";
  return "event = " + event + " \n variables = " + variables + " \n rulebase = " + rulebase;
}

}  // namespace tarvod
