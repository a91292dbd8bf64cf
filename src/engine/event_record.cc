#include "engine/event_record.h"

#include <cmath>
#include <cstdint>
#include <string>
#include <unordered_map>

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
// Names are looked up one by one while the record is small (every usual event), through an
// index once it grows.
class Record {
 public:
  bool set(const std::string& name, std::string value) {
    if (mAttributes.size() < kLinearAttributes) {
      for (auto& attribute : mAttributes) {
        if (attribute.first == name) {
          attribute.second = std::move(value);
          return true;
        }
      }
    } else {
      if (mIndex.empty()) {
        for (size_t i = 0; i < mAttributes.size(); ++i) mIndex.emplace(mAttributes[i].first, i);
      }
      auto found = mIndex.find(name);
      if (found != mIndex.end()) {
        mAttributes[found->second].second = std::move(value);
        return true;
      }
      if (mAttributes.size() >= kMaxRecordAttributes) return false;
      mIndex.emplace(name, mAttributes.size());
    }
    mAttributes.emplace_back(name, std::move(value));
    return true;
  }
  const LogAttributes& attributes() const { return mAttributes; }

 private:
  LogAttributes mAttributes;
  std::unordered_map<std::string, size_t> mIndex;
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

bool Configure(Record& record, const std::string& name, std::string value) {
  if (record.set(name, std::move(value))) return true;
  LogMessage(0, "Failed to configure KVLOG message with key %s", name.c_str());
  return false;
}

}  // namespace

void WriteEventRecord(const plist::Dictionary& event, bool hasRules, bool eventBlocked) {
  const plist::Value* typeValue = event.find("eventType");
  const std::string type = typeValue ? typeValue->textForm() : "(null)";
  LogMessage(4, "Logging event %s to KVLOG tarvod database", type.c_str());

  Record record;
  for (const auto& [key, value] : event) {
    if (key == "eventDetails") {
      if (const plist::Dictionary* details = value.asDictionary()) {
        for (const auto& [detailKey, detailValue] : *details) {
          if (!Configure(record, detailKey, detailValue.textForm())) return;
        }
      } else if (!Configure(record, key, value.textForm())) {
        return;  // details that are not a dictionary are kept as one attribute
      }
    } else if (key == "eventTimestamp") {
      const auto [seconds, nanoseconds] = UnixTime(value.numberValue());
      if (!Configure(record, "Time", std::to_string(seconds))) return;
      if (!Configure(record, "TimeNanoSec", std::to_string(nanoseconds))) return;
    } else if (!Configure(record, key, value.textForm())) {
      return;
    }
  }
  if (!Configure(record, "hasRules", hasRules ? "true" : "false")) return;
  if (!Configure(record, "eventBlocked", eventBlocked ? "true" : "false")) return;
  if (!Configure(record, "Level", "Alert")) return;

  const std::string message = type + " hasRules=" + (hasRules ? "true" : "false") +
                              " eventBlocked=" + (eventBlocked ? "true" : "false");
  if (!DefaultStructuredLog().send(kRecordPriority, message, record.attributes())) {
    LogMessage(0, "Failed to log event %s to KVLOG tarvod database", type.c_str());
  }
}

}  // namespace tarvod
