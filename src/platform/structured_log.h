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
};

// Selects the sink: the journal when path is empty, else the JSON-lines file at path.
void ConfigureStructuredLog(const std::string& jsonLinesPath);
StructuredLog& DefaultStructuredLog();

}  // namespace tarvod
