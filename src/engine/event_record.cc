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
  bool set(std::string_view name, std::string_view value) {
    if (mAttributes.size() < kLinearAttributes) {
      for (auto& attribute : mAttributes) {
        if (attribute.first == name) {
          attribute.second = value;
          return true;
        }
      }
    } else {
      if (mIndex.empty()) {
        for (size_t i = 0; i < mAttributes.size(); ++i) mIndex.emplace(mAttributes[i].first, i);
      }
      auto found = mIndex.find(name);
      if (found != mIndex.end()) {
        mAttributes[found->second].second = value;
        return true;
      }
      if (mAttributes.size() >= kMaxRecordAttributes) return false;
      mIndex.emplace(name, mAttributes.size());
    }
    mAttributes.emplace_back(name, value);
    return true;
  }
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

bool Configure(Record& record, std::string_view name, std::string_view value) {
  if (record.set(name, value)) return true;
  LogMessage(0, "Failed to configure KVLOG message with key %.*s", static_cast<int>(name.size()),
             name.data());
  return false;
}

}  // namespace

void WriteEventRecord(const plist::Dictionary& event, bool hasRules, bool eventBlocked) {
  const plist::Value* typeValue = event.find("eventType");
  const std::string type = typeValue ? typeValue->textForm() : "(null)";
  LogMessage(4, "Logging event %s to KVLOG tarvod database", type.c_str());

  Record record;
  // Room for the event's keys, its details and the five the record adds, in one allocation.
  const plist::Dictionary* lifted = event.findDictionary("eventDetails");
  record.reserve(event.size() + (lifted ? lifted->size() : 0) + 5);
  for (const auto& [key, value] : event) {
    if (key == "eventDetails") {
      if (const plist::Dictionary* details = value.asDictionary()) {
        for (const auto& [detailKey, detailValue] : *details) {
          if (!Configure(record, detailKey, record.text(detailValue))) return;
        }
      } else if (!Configure(record, key, record.text(value))) {
        return;  // details that are not a dictionary are kept as one attribute
      }
    } else if (key == "eventTimestamp") {
      const auto [seconds, nanoseconds] = UnixTime(value.numberValue());
      if (!Configure(record, "Time", record.keep(std::to_string(seconds)))) return;
      if (!Configure(record, "TimeNanoSec", record.keep(std::to_string(nanoseconds)))) return;
    } else if (!Configure(record, key, record.text(value))) {
      return;
    }
  }
  if (!Configure(record, "hasRules", hasRules ? "true" : "false")) return;
  if (!Configure(record, "eventBlocked", eventBlocked ? "true" : "false")) return;
  if (!Configure(record, "Level", "Alert")) return;

  const std::string message = type + " hasRules=" + (hasRules ? "true" : "false") +
                              " eventBlocked=" + (eventBlocked ? "true" : "false");
  if (!DefaultStructuredLog().sendAttributes(kRecordPriority, message, record.attributes())) {
    LogMessage(0, "Failed to log event %s to KVLOG tarvod database", type.c_str());
  }
}

}  // namespace tarvod
