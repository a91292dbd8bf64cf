// Building rules files for integration tests: property-list XML from small pieces, escaped.
// Test thread only.
#pragma once

#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "harness.h"

namespace tarvod::testing {

inline std::string XmlText(std::string_view text) {
  std::string out;
  for (const char c : text) {
    if (c == '&') {
      out += "&amp;";
    } else if (c == '<') {
      out += "&lt;";
    } else if (c == '>') {
      out += "&gt;";
    } else {
      out += c;
    }
  }
  return out;
}

inline std::string Str(std::string_view text) { return "<string>" + XmlText(text) + "</string>"; }
inline std::string Int(long value) { return "<integer>" + std::to_string(value) + "</integer>"; }
inline std::string Bool(bool value) { return value ? "<true/>" : "<false/>"; }

inline std::string Arr(const std::vector<std::string>& items) {
  std::string out = "<array>";
  for (const auto& item : items) out += item;
  return out + "</array>";
}

inline std::string Dict(const std::vector<std::pair<std::string, std::string>>& entries) {
  std::string out = "<dict>";
  for (const auto& [key, value] : entries) out += "<key>" + XmlText(key) + "</key>" + value;
  return out + "</dict>";
}

// A rule subscribed to the given types, with further entries (criterion, actions, ...).
inline std::string RuleXml(std::string_view name, const std::vector<std::string>& types,
                           std::vector<std::pair<std::string, std::string>> entries = {}) {
  std::vector<std::string> typeXml;
  for (const auto& type : types) typeXml.push_back(Str(type));
  entries.insert(entries.begin(), {{"name", Str(name)}, {"eventTypes", Arr(typeXml)}});
  return Dict(entries);
}

inline std::string RulesDocument(const std::vector<std::string>& rules) {
  return PlistDocument(Arr(rules));
}

// A log action appending message to path.
inline std::string FileLog(std::string_view message, std::string_view path) {
  return Dict({{"type", Str("log")}, {"message", Str(message)}, {"logPath", Str(path)}});
}

inline std::string Criterion(std::string_view op, const std::vector<std::string>& operands = {}) {
  return Dict({{"operator", Str(op)}, {"operands", Arr(operands)}});
}

}  // namespace tarvod::testing
