#include "engine/event_record.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdint>
#include <forward_list>
#include <span>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform/diagnostic_log.h"
#include "platform/structured_log.h"

namespace tarvod {
namespace {

// Severity of every event record: the journal's "alert".
constexpr int kRecordPriority = 1;
// Attributes one record may carry. An event with more keys than this (a sender can send tens
// of thousands) fails to configure its record instead of making an entry the journal refuses.
constexpr size_t kMaxRecordAttributes = 1000;
constexpr size_t kLinearAttributes = 16;

// A record under construction: a later value for a name replaces the earlier one in place.
// Names and string values are views of the event (which outlives the record); other values'
// text forms are kept by the record. Names are looked up one by one while the record is small
// (every usual event), through an index once it grows.
class Record {
 public:
  // The index the attribute has; -1 when the record cannot take another.
  ptrdiff_t set(std::string_view name, std::string_view value) {
    if (mAttributes.size() < kLinearAttributes) {
      for (size_t i = 0; i < mAttributes.size(); ++i) {
        if (mAttributes[i].first == name) {
          mAttributes[i].second = value;
          return static_cast<ptrdiff_t>(i);
        }
      }
    } else {
      if (mIndex.empty()) {
        for (size_t i = 0; i < mAttributes.size(); ++i) mIndex.emplace(mAttributes[i].first, i);
      }
      auto found = mIndex.find(name);
      if (found != mIndex.end()) {
        mAttributes[found->second].second = value;
        return static_cast<ptrdiff_t>(found->second);
      }
      if (mAttributes.size() >= kMaxRecordAttributes) return -1;
      mIndex.emplace(name, mAttributes.size());
    }
    mAttributes.emplace_back(name, value);
    return static_cast<ptrdiff_t>(mAttributes.size() - 1);
  }
  void assign(size_t index, std::string_view value) { mAttributes[index].second = value; }
  // The text form of value, kept as long as the record.
  std::string_view text(const plist::Value& value) {
    if (const std::string* string = value.asString()) return *string;
    return keep(value.textForm());
  }
  std::string_view keep(std::string text) {
    if (mInlineUsed < mInline.size()) return mInline[mInlineUsed++] = std::move(text);
    return mMore.emplace_front(std::move(text));
  }
  std::span<const LogAttributeView> attributes() const { return mAttributes; }
  void reserve(size_t n) { mAttributes.reserve(std::min(n, kMaxRecordAttributes)); }

 private:
  std::vector<LogAttributeView> mAttributes;
  std::unordered_map<std::string_view, size_t> mIndex;
  // Kept texts, at stable addresses: the first few in place, the rest in list nodes.
  std::array<std::string, 4> mInline;
  size_t mInlineUsed = 0;
  std::forward_list<std::string> mMore;
};

// Unix seconds and the nanoseconds of that second, from seconds since 2001. Times before 1970,
// beyond the 64-bit range, or not a number are clamped, never converted with undefined results.
std::pair<uint64_t, uint64_t> UnixTime(double since2001) {
  const double unix = since2001 + plist::kUnixTimeOfReferenceDate;
  if (!(unix >= 0)) return {0, 0};
  if (unix >= 18446744073709551615.0) return {UINT64_MAX, 0};
  const double whole = std::floor(unix);
  const auto seconds = static_cast<uint64_t>(whole);
  auto nanoseconds = static_cast<uint64_t>((unix - whole) * 1000000000.0);
  if (nanoseconds > 999999999) nanoseconds = 999999999;
  return {seconds, nanoseconds};
}

// Sets one attribute: its index, or -1, with the failure logged, when the record cannot take it.
ptrdiff_t Configure(Record& record, std::string_view name, std::string_view value) {
  const ptrdiff_t index = record.set(name, value);
  if (index < 0) {
    LogMessage(0, "Failed to configure KVLOG message with key %.*s", static_cast<int>(name.size()),
               name.data());
  }
  return index;
}

}  // namespace

struct EventRecord::Attributes {
  std::string type;
  Record record;
  // Where the flags go.
  size_t hasRules = 0;
  size_t eventBlocked = 0;
  // Everything before the first flag is the same in each record of the event.
  AttributeCache cache;
  // Whether every attribute was taken; if not, the name of the one refused.
  bool complete = false;
  std::string failed;
};

EventRecord::EventRecord(const plist::Dictionary& event) : mEvent(event) {}

EventRecord::~EventRecord() = default;

void EventRecord::write(bool hasRules, bool eventBlocked) {
  const bool first = !mAttributes;
  if (first) {
    mAttributes = std::make_unique<Attributes>();
    const plist::Value* typeValue = mEvent.find("eventType");
    mAttributes->type = typeValue ? typeValue->textForm() : "(null)";
  }
  Attributes& a = *mAttributes;
  LogMessage(4, "Logging event %s to KVLOG tarvod database", a.type.c_str());
  if (first) {
    a.complete = Gather(mEvent, a);
  } else if (!a.complete) {
    // Each record the event would have had reports the refusal, as the first one did.
    LogMessage(0, "Failed to configure KVLOG message with key %s", a.failed.c_str());
  }
  if (!a.complete) return;
  a.record.assign(a.hasRules, hasRules ? "true" : "false");
  a.record.assign(a.eventBlocked, eventBlocked ? "true" : "false");

  const std::string message = a.type + " hasRules=" + (hasRules ? "true" : "false") +
                              " eventBlocked=" + (eventBlocked ? "true" : "false");
  if (!DefaultStructuredLog().sendAttributes(kRecordPriority, message, a.record.attributes(),
                                             a.cache)) {
    LogMessage(0, "Failed to log event %s to KVLOG tarvod database", a.type.c_str());
  }
}

// The event's keys and details flattened, the time split into seconds and nanoseconds, then
// the flags and the level. A later value for a name replaces the earlier one in place, so an
// event key named like a flag holds the flag's place.
bool EventRecord::Gather(const plist::Dictionary& event, Attributes& a) {
  Record& record = a.record;
  // Room for the event's keys, its details and the five the record adds, in one allocation.
  const plist::Dictionary* lifted = event.findDictionary("eventDetails");
  record.reserve(event.size() + (lifted ? lifted->size() : 0) + 5);
  const auto add = [&](std::string_view name, std::string_view value) {
    const ptrdiff_t index = Configure(record, name, value);
    if (index < 0) a.failed = std::string(name);
    return index;
  };
  for (const auto& [key, value] : event) {
    if (key == "eventDetails") {
      if (const plist::Dictionary* details = value.asDictionary()) {
        for (const auto& [detailKey, detailValue] : *details) {
          if (add(detailKey, record.text(detailValue)) < 0) return false;
        }
      } else if (add(key, record.text(value)) < 0) {
        return false;  // details that are not a dictionary are kept as one attribute
      }
    } else if (key == "eventTimestamp") {
      const auto [seconds, nanoseconds] = UnixTime(value.numberValue());
      if (add("Time", record.keep(std::to_string(seconds))) < 0) return false;
      if (add("TimeNanoSec", record.keep(std::to_string(nanoseconds))) < 0) return false;
    } else if (add(key, record.text(value)) < 0) {
      return false;
    }
  }
  const ptrdiff_t hasRules = add("hasRules", "false");
  if (hasRules < 0) return false;
  const ptrdiff_t eventBlocked = add("eventBlocked", "false");
  if (eventBlocked < 0) return false;
  if (add("Level", "Alert") < 0) return false;
  a.hasRules = static_cast<size_t>(hasRules);
  a.eventBlocked = static_cast<size_t>(eventBlocked);
  a.cache.stable = std::min(a.hasRules, a.eventBlocked);
  return true;
}

void WriteEventRecord(const plist::Dictionary& event, bool hasRules, bool eventBlocked) {
  EventRecord(event).write(hasRules, eventBlocked);
}

}  // namespace tarvod
