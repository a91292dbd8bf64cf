// Reading and writing property lists. Readers take untrusted bytes: they never crash, hang or
// exhaust memory, and anything malformed (truncated, invalid UTF-8, nested deeper than
// kMaxNestingDepth, a binary list whose offsets point outside the data or loop, or one that
// expands past MaxExpandedBytes) reads as std::nullopt. Safe to call from any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "plist/value.h"

namespace plist {

inline constexpr int kMaxNestingDepth = 256;
// Files larger than this are not read: no configuration, rules or state file comes near it.
inline constexpr size_t kMaxFileSize = 64 * 1024 * 1024;
// A binary list may name one string or data object from many places, and reading it copies the
// object at every one of them. The bytes so copied (strings, keys and data, counted at every
// reference) may reach kMaxExpansionFactor times the input's size plus kExpansionAllowance; a
// list that expands further reads as std::nullopt.
inline constexpr uint64_t kMaxExpansionFactor = 16;
inline constexpr uint64_t kExpansionAllowance = 64 * 1024;
constexpr uint64_t MaxExpandedBytes(uint64_t inputSize) {
  return kMaxExpansionFactor * inputSize + kExpansionAllowance;
}

// Reads a property list in XML, binary ("bplist00") or old-style text form; the format is
// detected from the bytes.
std::optional<Value> ReadPropertyList(std::string_view bytes);
// Reads a whole file with ReadPropertyList; nullopt when it cannot be read.
std::optional<Value> ReadPropertyListFile(const std::string& path);

// The old-style text reader on its own. Besides the forms Describe writes, it accepts a
// ".strings" table: a sequence of "key" = "value"; pairs without enclosing braces.
std::optional<Value> ParseTextPropertyList(std::string_view text);

// The XML property-list (version 1.0) serialisation of a value; nullopt on failure.
std::optional<std::string> WriteXmlPropertyList(const Value& value);

}  // namespace plist
