// Helpers of the builtin variables (Context::valueForBuiltinVariableKey), declared for tests.
// Called on the processing queue (or the main thread while rules load).
#pragma once

#include <string>
#include <string_view>

#include "platform/host_stats.h"

namespace tarvod {

// "HH:MM:SS.SSS" -> signed seconds (negated when forward is false). A text that does not
// split into exactly three parts at ":" logs the malformed-interval message and gives 0.
double ParseInterval(std::string_view interval, bool forward);

// The figure of a "system:" key from a snapshot: bytes as unsigned decimal text, or
// "not-implemented" for keys without a figure.
std::string SystemStatForKey(std::string_view key, const StatContext& stats);

// The current time in seconds since 2001-01-01 00:00:00 UTC.
double SecondsSince2001Now();

}  // namespace tarvod
