// Format suffixes of variable references ("%t", "%m", "%5.1f", "%x", ...). Suffixes come
// from rule files, so formatting never hands the C formatter anything but one conversion with
// one argument of the matching kind: every suffix yields a defined, bounded text.
#pragma once

#include <optional>
#include <string_view>

#include "plist/value.h"

namespace tarvod {

// Applies a (trimmed, non-empty) suffix to a looked-up value, absent counting as 0:
// "%t" a date's text form, "%m" a human-readable byte amount, a suffix with a float,
// unsigned or signed trigger character printf-style formatting; any other suffix returns
// the value unchanged (nullopt stays nullopt).
std::optional<plist::Value> ApplyFormatSuffix(const std::optional<plist::Value>& value,
                                              std::string_view suffix);

// Whether ApplyFormatSuffix formats with this (trimmed, non-empty) suffix rather than returning
// the value unchanged.
bool IsAppliedFormatSuffix(std::string_view suffix);

}  // namespace tarvod
