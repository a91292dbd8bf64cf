// Unit-test helper: reads back the structured log's JSON-lines file. Each line is parsed
// strictly (objects, strings with their escapes, integers); a line that does not parse yields
// a record with parsed == false. Test thread only.
#pragma once

#include <cstdint>
#include <fstream>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace tarvod::testing {

struct JsonRecord {
  bool parsed = false;
  std::string identifier;
  int64_t priority = -1;
  std::string message;
  std::vector<std::pair<std::string, std::string>> attributes;  // in file order
  std::optional<std::string> attribute(const std::string& name) const {
    for (const auto& [key, value] : attributes) {
      if (key == name) return value;
    }
    return std::nullopt;
  }
};

class JsonLineParser {
 public:
  explicit JsonLineParser(const std::string& line) : mText(line) {}

  JsonRecord parse() {
    JsonRecord record;
    bool ok = expect('{');
    while (ok && !peek('}')) {
      std::optional<std::string> key = string();
      ok = key && expect(':');
      if (!ok) break;
      if (*key == "identifier" || *key == "message") {
        std::optional<std::string> value = string();
        ok = value.has_value();
        if (ok) (*key == "identifier" ? record.identifier : record.message) = *value;
      } else if (*key == "priority") {
        ok = integer(record.priority);
      } else if (*key == "attributes") {
        ok = attributes(record.attributes);
      } else {
        ok = false;
      }
      if (ok && !peek('}')) ok = expect(',');
    }
    ok = ok && expect('}');
    skipBlanks();
    record.parsed = ok && mPos == mText.size();
    return record;
  }

 private:
  void skipBlanks() {
    while (mPos < mText.size() && (mText[mPos] == ' ' || mText[mPos] == '\t')) ++mPos;
  }
  bool peek(char c) {
    skipBlanks();
    return mPos < mText.size() && mText[mPos] == c;
  }
  bool expect(char c) {
    if (!peek(c)) return false;
    ++mPos;
    return true;
  }
  bool integer(int64_t& out) {
    skipBlanks();
    size_t start = mPos;
    while (mPos < mText.size() && mText[mPos] >= '0' && mText[mPos] <= '9') ++mPos;
    if (start == mPos) return false;
    out = std::stoll(mText.substr(start, mPos - start));
    return true;
  }
  std::optional<std::string> string() {
    if (!expect('"')) return std::nullopt;
    std::string out;
    while (mPos < mText.size()) {
      const char c = mText[mPos++];
      if (c == '"') return out;
      if (static_cast<unsigned char>(c) < 0x20) return std::nullopt;
      if (c != '\\') {
        out += c;
        continue;
      }
      if (mPos >= mText.size()) return std::nullopt;
      const char e = mText[mPos++];
      switch (e) {
        case '"':
          out += '"';
          break;
        case '\\':
          out += '\\';
          break;
        case '/':
          out += '/';
          break;
        case 'n':
          out += '\n';
          break;
        case 'r':
          out += '\r';
          break;
        case 't':
          out += '\t';
          break;
        case 'b':
          out += '\b';
          break;
        case 'f':
          out += '\f';
          break;
        case 'u': {
          if (mPos + 4 > mText.size()) return std::nullopt;
          const unsigned long code = std::stoul(mText.substr(mPos, 4), nullptr, 16);
          mPos += 4;
          if (code >= 0x80) return std::nullopt;  // the sink escapes only control characters
          out += static_cast<char>(code);
          break;
        }
        default:
          return std::nullopt;
      }
    }
    return std::nullopt;
  }
  bool attributes(std::vector<std::pair<std::string, std::string>>& out) {
    if (!expect('{')) return false;
    while (!peek('}')) {
      std::optional<std::string> key = string();
      if (!key || !expect(':')) return false;
      std::optional<std::string> value = string();
      if (!value) return false;
      out.emplace_back(*key, *value);
      if (!peek('}') && !expect(',')) return false;
    }
    return expect('}');
  }

  const std::string mText;
  size_t mPos = 0;
};

// Every line of the file; an unreadable file gives none.
inline std::vector<JsonRecord> ReadJsonRecords(const std::string& path) {
  std::vector<JsonRecord> records;
  std::ifstream in(path, std::ios::binary);
  std::string line;
  while (std::getline(in, line)) records.push_back(JsonLineParser(line).parse());
  return records;
}

}  // namespace tarvod::testing
