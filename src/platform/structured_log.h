// The structured system log: the systemd journal, or a JSON-lines file when the configuration
// names one. Records are sent from the processing queue and from dispatching threads; Send
// may be called from any thread.
#pragma once

#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace tarvod {

using LogAttributes = std::vector<std::pair<std::string, std::string>>;

class StructuredLog {
 public:
  virtual ~StructuredLog() = default;
  // Sends one record; false when it could not be delivered.
  virtual bool send(int priority, std::string_view message, const LogAttributes& attributes) = 0;
  // False when every record is bound to fail: the journal is the sink and its socket is
  // missing (a host without journald). A file sink is taken to be able to deliver.
  virtual bool canDeliver() { return true; }
};

// Selects the sink: the journal when path is empty, else the JSON-lines file at path (one
// object per line: identifier, priority, message, attributes under their own names). Until
// the first call the sink is the journal.
void ConfigureStructuredLog(const std::string& jsonLinesPath);
// The sink in use. The reference stays valid for the life of the process.
StructuredLog& DefaultStructuredLog();

// The journal field that carries an attribute: the name upper-cased, every character outside
// A-Z, 0-9 and "_" replaced by "_"; an "A" put in front when the result is empty, begins with
// a digit or "_", or is a field the journal or the record itself uses (MESSAGE, PRIORITY,
// SYSLOG_IDENTIFIER, ...); then cut to 64 characters. "clientIP" -> CLIENTIP, "message" ->
// AMESSAGE, "1st-try" -> A1ST_TRY.
std::string JournalFieldName(std::string_view attribute);

}  // namespace tarvod
