// The structured system log: the systemd journal, or a JSON-lines file when the configuration
// names one. Records are sent from the processing queue and from dispatching threads; send,
// FlushStructuredLog and HoldStructuredLogRecordsOnThisThread may be called from any thread.
#pragma once

#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace tarvod {

using LogAttributes = std::vector<std::pair<std::string, std::string>>;
// An attribute seen through views, so that a record can be made of the event's own strings.
using LogAttributeView = std::pair<std::string_view, std::string_view>;

// What a sink keeps of the first `stable` attributes of a record for the next record that has
// the same ones: the several records of one event differ only in their last attributes.
struct AttributeCache {
  size_t stable = 0;
  bool filled = false;
  std::string text;  // the sink's own form of those attributes
};

class StructuredLog {
 public:
  virtual ~StructuredLog() = default;
  // Sends one record; false when it could not be delivered.
  virtual bool sendAttributes(int priority, std::string_view message,
                              std::span<const LogAttributeView> attributes) = 0;
  // The same, for a caller that sends records with the same first cache.stable attributes
  // (unchanged since the cache was first used); a sink may reuse their formatted form.
  virtual bool sendAttributes(int priority, std::string_view message,
                              std::span<const LogAttributeView> attributes, AttributeCache& cache) {
    return sendAttributes(priority, message, attributes);
  }
  bool send(int priority, std::string_view message, const LogAttributes& attributes) {
    std::vector<LogAttributeView> views(attributes.begin(), attributes.end());
    return sendAttributes(priority, message, views);
  }
  // False when every record is bound to fail: the journal is the sink and its socket is
  // missing (a host without journald). A file sink is taken to be able to deliver.
  virtual bool canDeliver() { return true; }
  // Writes the records held for threads that hold theirs (see below); a no-op for the journal.
  virtual void flush() {}
  // Another sink replaces this one: write what is held and let go of the file.
  virtual void retire() { flush(); }
};

// Selects the sink: the journal when path is empty, else the JSON-lines file at path (one
// object per line: identifier, priority, message, attributes under their own names). Until
// the first call the sink is the journal.
void ConfigureStructuredLog(const std::string& jsonLinesPath);
// The sink in use. The reference stays valid for the life of the process.
StructuredLog& DefaultStructuredLog();

// From now on the JSON-lines records the calling thread sends are held, in order, and written
// together (one write) at the next FlushStructuredLog, or as soon as kMaxHeldRecordBytes are
// held; other threads' records are written at once, after the held ones. For a thread that
// calls FlushStructuredLog whenever it runs out of work (the processing queue), so that no
// record is held back longer than the work queued before it. The journal sends every record at
// once either way.
void HoldStructuredLogRecordsOnThisThread();
inline constexpr size_t kMaxHeldRecordBytes = 64 * 1024;
// Writes the held records. A write that fails is logged once, at level 0, with the number of
// records it lost.
void FlushStructuredLog();

// The journal field that carries an attribute: the name upper-cased, every character outside
// A-Z, 0-9 and "_" replaced by "_"; an "A" put in front when the result is empty, begins with
// a digit or "_", or is a field the journal or the record itself uses (MESSAGE, PRIORITY,
// SYSLOG_IDENTIFIER, ...); then cut to 64 characters. "clientIP" -> CLIENTIP, "message" ->
// AMESSAGE, "1st-try" -> A1ST_TRY.
std::string JournalFieldName(std::string_view attribute);

}  // namespace tarvod
