// The operator and action keyword tables and the processing queue, built once at startup by
// BuildKeywordTables before any rule is loaded and only read afterwards (from any thread).
#pragma once

#include <optional>
#include <string_view>

#include "platform/serial_queue.h"

namespace tarvod {

void BuildKeywordTables();
// The code of a lower-case keyword; nullopt when it is not in the table.
std::optional<int> OperatorCode(std::string_view keyword);
std::optional<int> ActionCode(std::string_view keyword);
// "com.quenta.tarvod.processq": every rule job and record job runs here.
SerialQueue& ProcessingQueue();

}  // namespace tarvod
