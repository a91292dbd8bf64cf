// The reader of the old-style text form: everything Describe writes, and ".strings" tables.
// One pass over the text (linear time), recursion counted against kMaxNestingDepth, and every
// look at a character checks the end first.
#include <charconv>
#include <cmath>
#include <cstdint>
#include <limits>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "plist/codec.h"

namespace plist {

namespace {

bool IsBlank(char c) {
  return c == ' ' || c == '\t' || c == '\n' || c == '\r' || c == '\f' || c == '\v';
}
bool IsDigit(char c) { return c >= '0' && c <= '9'; }
bool IsLetter(char c) { return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z'); }
// Characters of an unquoted token: Describe's plain-word characters, plus '+' for exponents.
bool IsBareChar(char c) {
  return IsLetter(c) || IsDigit(c) || c == '_' || c == '$' || c == '/' || c == '.' || c == '-' ||
         c == ':' || c == '+';
}
int HexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

void AppendUtf8(std::string& out, uint32_t codePoint) {
  if (codePoint < 0x80) {
    out += static_cast<char>(codePoint);
  } else if (codePoint < 0x800) {
    out += static_cast<char>(0xC0 | (codePoint >> 6));
    out += static_cast<char>(0x80 | (codePoint & 0x3F));
  } else if (codePoint < 0x10000) {
    out += static_cast<char>(0xE0 | (codePoint >> 12));
    out += static_cast<char>(0x80 | ((codePoint >> 6) & 0x3F));
    out += static_cast<char>(0x80 | (codePoint & 0x3F));
  } else {
    out += static_cast<char>(0xF0 | (codePoint >> 18));
    out += static_cast<char>(0x80 | ((codePoint >> 12) & 0x3F));
    out += static_cast<char>(0x80 | ((codePoint >> 6) & 0x3F));
    out += static_cast<char>(0x80 | (codePoint & 0x3F));
  }
}

bool IsHighSurrogate(uint32_t u) { return u >= 0xD800 && u <= 0xDBFF; }
bool IsLowSurrogate(uint32_t u) { return u >= 0xDC00 && u <= 0xDFFF; }

// Tables written by other systems are often UTF-16 with a byte-order mark; the reader works
// on UTF-8, so such text is converted first. nullopt on an unpaired surrogate or odd length.
std::optional<std::string> Utf16ToUtf8(std::string_view bytes, bool bigEndian) {
  if (bytes.size() % 2 != 0) return std::nullopt;
  std::string out;
  out.reserve(bytes.size());
  const auto unit = [&](size_t i) -> uint32_t {
    const auto b0 = static_cast<unsigned char>(bytes[i]);
    const auto b1 = static_cast<unsigned char>(bytes[i + 1]);
    return bigEndian ? (b0 << 8 | b1) : (b1 << 8 | b0);
  };
  for (size_t i = 0; i < bytes.size(); i += 2) {
    uint32_t u = unit(i);
    if (IsHighSurrogate(u)) {
      if (i + 3 >= bytes.size() || !IsLowSurrogate(unit(i + 2))) return std::nullopt;
      u = 0x10000 + ((u - 0xD800) << 10) + (unit(i + 2) - 0xDC00);
      i += 2;
    } else if (IsLowSurrogate(u)) {
      return std::nullopt;
    }
    AppendUtf8(out, u);
  }
  return out;
}

// A bare token is a boolean, an integer, a real or else a string, in the way Describe writes
// them: Describe quotes every string that would read as one of the others.
Value ClassifyBareToken(std::string_view token) {
  if (token == "true") return Value::Boolean(true);
  if (token == "false") return Value::Boolean(false);
  size_t i = 0;
  if (token[0] == '-' || token[0] == '+') ++i;
  const size_t digitsStart = i;
  while (i < token.size() && IsDigit(token[i])) ++i;
  if (i == digitsStart) return Value(token);
  const std::string_view number = token.substr(token[0] == '+' ? 1 : 0);
  if (i == token.size()) {
    int64_t integer = 0;
    auto [ptr, ec] = std::from_chars(number.data(), number.data() + number.size(), integer);
    if (ec == std::errc() && ptr == number.data() + number.size()) return Value::Integer(integer);
    // Beyond the 64-bit range: keep the magnitude as a real rather than wrap it.
  } else {
    if (token[i] == '.') {
      const size_t fraction = ++i;
      while (i < token.size() && IsDigit(token[i])) ++i;
      if (i == fraction) return Value(token);
    }
    if (i < token.size() && (token[i] == 'e' || token[i] == 'E')) {
      ++i;
      if (i < token.size() && (token[i] == '+' || token[i] == '-')) ++i;
      const size_t exponent = i;
      while (i < token.size() && IsDigit(token[i])) ++i;
      if (i == exponent) return Value(token);
    }
    if (i != token.size()) return Value(token);
  }
  double real = 0;
  auto [ptr, ec] = std::from_chars(number.data(), number.data() + number.size(), real);
  if (ec != std::errc() || ptr != number.data() + number.size()) return Value(token);
  return Value::Real(real);
}

class TextReader {
 public:
  explicit TextReader(std::string_view text) : mText(text) {}

  std::optional<Value> readDocument() {
    if (!skipBlanks() || atEnd()) return std::nullopt;
    // A ".strings" table starts with a key followed by "=" (or ";" for a key that is its own
    // value); anything else is one value.
    if (peek() == '"' || peek() == '\'' || IsBareChar(peek())) {
      const size_t start = mPos;
      if (readKey() && skipBlanks() && !atEnd() && (peek() == '=' || peek() == ';')) {
        mPos = start;
        Dictionary table;
        if (!readDictionaryBody(table, /*braced=*/false, 1)) return std::nullopt;
        return Value(std::move(table));
      }
      mPos = start;
    }
    std::optional<Value> value = readValue(0);
    if (!value || !skipBlanks() || !atEnd()) return std::nullopt;
    return value;
  }

 private:
  bool atEnd() const { return mPos >= mText.size(); }
  char peek() const { return mText[mPos]; }
  bool startsWith(std::string_view s) const { return mText.substr(mPos).starts_with(s); }

  // Skips white space and comments; false on a comment that never ends.
  bool skipBlanks() {
    while (!atEnd()) {
      if (IsBlank(peek())) {
        ++mPos;
      } else if (startsWith("//")) {
        const size_t end = mText.find('\n', mPos);
        mPos = end == std::string_view::npos ? mText.size() : end + 1;
      } else if (startsWith("/*")) {
        const size_t end = mText.find("*/", mPos + 2);
        if (end == std::string_view::npos) return false;
        mPos = end + 2;
      } else {
        break;
      }
    }
    return true;
  }

  // depth: the number of containers around the value.
  std::optional<Value> readValue(int depth) {
    if (!skipBlanks() || atEnd()) return std::nullopt;
    const char c = peek();
    if (c == '{' || c == '(') {
      if (depth >= kMaxNestingDepth) return std::nullopt;
      ++mPos;
      if (c == '(') return readArrayBody(depth + 1);
      Dictionary dictionary;
      if (!readDictionaryBody(dictionary, /*braced=*/true, depth + 1)) return std::nullopt;
      return Value(std::move(dictionary));
    }
    if (c == '<') return readAngled();
    if (c == '"' || c == '\'') {
      std::optional<std::string> s = readQuoted();
      if (!s) return std::nullopt;
      return Value(std::move(*s));
    }
    if (IsBareChar(c)) return ClassifyBareToken(readBareToken());
    return std::nullopt;
  }

  std::optional<Value> readArrayBody(int depth) {
    Array array;
    if (!skipBlanks() || atEnd()) return std::nullopt;
    if (peek() == ')') {
      ++mPos;
      return Value(std::move(array));
    }
    while (true) {
      std::optional<Value> item = readValue(depth);
      if (!item) return std::nullopt;
      array.push_back(std::move(*item));
      if (!skipBlanks() || atEnd()) return std::nullopt;
      if (peek() == ')') break;
      if (peek() != ',') return std::nullopt;
      ++mPos;
      // A comma before the closing parenthesis is accepted.
      if (!skipBlanks() || atEnd()) return std::nullopt;
      if (peek() == ')') break;
    }
    ++mPos;
    return Value(std::move(array));
  }

  // Entries up to "}" (braced) or to the end of the text (a strings table).
  bool readDictionaryBody(Dictionary& out, bool braced, int depth) {
    std::vector<Dictionary::Entry> entries;
    while (true) {
      if (!skipBlanks()) return false;
      if (atEnd()) {
        if (braced) return false;
        break;
      }
      if (braced && peek() == '}') {
        ++mPos;
        break;
      }
      std::optional<std::string> key = readKey();
      if (!key || !skipBlanks() || atEnd()) return false;
      if (peek() == ';') {
        ++mPos;
        Value value(*key);
        entries.emplace_back(std::move(*key), std::move(value));
        continue;
      }
      if (peek() != '=') return false;
      ++mPos;
      std::optional<Value> value = readValue(depth);
      if (!value || !skipBlanks() || atEnd() || peek() != ';') return false;
      ++mPos;
      entries.emplace_back(std::move(*key), std::move(*value));
    }
    out = Dictionary::FromEntries(std::move(entries));
    return true;
  }

  // A key is a quoted string or a bare token taken as text ("1" is the key "1").
  std::optional<std::string> readKey() {
    if (atEnd()) return std::nullopt;
    if (peek() == '"' || peek() == '\'') return readQuoted();
    if (IsBareChar(peek())) return std::string(readBareToken());
    return std::nullopt;
  }

  std::string_view readBareToken() {
    const size_t start = mPos;
    while (!atEnd() && IsBareChar(peek())) ++mPos;
    return mText.substr(start, mPos - start);
  }

  // Up to four hex digits of a \U escape; nullopt when there are none.
  std::optional<uint32_t> readHexEscape() {
    uint32_t value = 0;
    size_t count = 0;
    while (count < 4 && !atEnd() && HexValue(peek()) >= 0) {
      value = value * 16 + static_cast<uint32_t>(HexValue(peek()));
      ++mPos;
      ++count;
    }
    if (count == 0) return std::nullopt;
    return value;
  }

  std::optional<std::string> readQuoted() {
    const char quote = peek();
    ++mPos;
    std::string out;
    while (true) {
      if (atEnd()) return std::nullopt;
      // Copy the run of ordinary characters at once.
      size_t end = mPos;
      while (end < mText.size() && mText[end] != quote && mText[end] != '\\') ++end;
      out.append(mText.substr(mPos, end - mPos));
      mPos = end;
      if (atEnd()) return std::nullopt;
      if (peek() == quote) {
        ++mPos;
        break;
      }
      ++mPos;  // the backslash
      if (atEnd()) return std::nullopt;
      const char c = peek();
      ++mPos;
      switch (c) {
        case 'n':
          out += '\n';
          break;
        case 't':
          out += '\t';
          break;
        case 'r':
          out += '\r';
          break;
        case 'a':
          out += '\a';
          break;
        case 'b':
          out += '\b';
          break;
        case 'f':
          out += '\f';
          break;
        case 'v':
          out += '\v';
          break;
        case 'U':
        case 'u': {
          std::optional<uint32_t> unit = readHexEscape();
          if (!unit) return std::nullopt;
          uint32_t codePoint = *unit;
          if (IsHighSurrogate(codePoint)) {
            // Characters beyond the basic plane come as a pair of escapes.
            if (!startsWith("\\U") && !startsWith("\\u")) return std::nullopt;
            mPos += 2;
            std::optional<uint32_t> low = readHexEscape();
            if (!low || !IsLowSurrogate(*low)) return std::nullopt;
            codePoint = 0x10000 + ((codePoint - 0xD800) << 10) + (*low - 0xDC00);
          } else if (IsLowSurrogate(codePoint)) {
            return std::nullopt;
          }
          AppendUtf8(out, codePoint);
          break;
        }
        default:
          if (c >= '0' && c <= '7') {
            // Up to three octal digits: one byte.
            unsigned value = static_cast<unsigned>(c - '0');
            for (int k = 0; k < 2 && !atEnd() && peek() >= '0' && peek() <= '7'; ++k) {
              value = value * 8 + static_cast<unsigned>(peek() - '0');
              ++mPos;
            }
            if (value > 0xFF) return std::nullopt;
            out += static_cast<char>(value);
          } else {
            out += c;  // \" \' \\ and any other character stand for themselves
          }
      }
    }
    // No NUL, raw or escaped: as in the other readers, a text value never holds one, since
    // the XML writer could not write it again.
    if (out.find('\0') != std::string::npos || !IsValidUtf8(out)) return std::nullopt;
    return out;
  }

  // "<" starts data ("<0fa1 22bc>") or a typed value: "<*D" date, "<*R" real, "<*I" integer,
  // "<*B" boolean (Y or N).
  std::optional<Value> readAngled() {
    ++mPos;  // '<'
    const size_t close = mText.find('>', mPos);
    if (close == std::string_view::npos) return std::nullopt;
    const std::string_view body = mText.substr(mPos, close - mPos);
    mPos = close + 1;
    if (!body.empty() && body[0] == '*') {
      if (body.size() < 2) return std::nullopt;
      return readTyped(body[1], body.substr(2));
    }
    Data data;
    data.reserve(body.size() / 2);
    int high = -1;
    for (char c : body) {
      if (IsBlank(c)) continue;
      const int nibble = HexValue(c);
      if (nibble < 0) return std::nullopt;
      if (high < 0) {
        high = nibble;
      } else {
        data.push_back(static_cast<uint8_t>(high << 4 | nibble));
        high = -1;
      }
    }
    if (high >= 0) return std::nullopt;
    return Value::FromData(std::move(data));
  }

  static std::optional<Value> readTyped(char type, std::string_view text) {
    switch (type) {
      case 'D': {
        std::optional<Date> date = ParseDate(text);
        if (!date) return std::nullopt;
        return Value::FromDate(*date);
      }
      case 'R': {
        if (text == "nan") return Value::Real(std::numeric_limits<double>::quiet_NaN());
        if (text == "inf" || text == "+inf") {
          return Value::Real(std::numeric_limits<double>::infinity());
        }
        if (text == "-inf") return Value::Real(-std::numeric_limits<double>::infinity());
        if (text.starts_with('+')) text.remove_prefix(1);
        double real = 0;
        auto [ptr, ec] = std::from_chars(text.data(), text.data() + text.size(), real);
        if (text.empty() || ec != std::errc() || ptr != text.data() + text.size()) {
          return std::nullopt;
        }
        return Value::Real(real);
      }
      case 'I': {
        if (text.starts_with('+')) text.remove_prefix(1);
        int64_t integer = 0;
        auto [ptr, ec] = std::from_chars(text.data(), text.data() + text.size(), integer);
        if (text.empty() || ec != std::errc() || ptr != text.data() + text.size()) {
          return std::nullopt;
        }
        return Value::Integer(integer);
      }
      case 'B':
        if (text == "Y") return Value::Boolean(true);
        if (text == "N") return Value::Boolean(false);
        return std::nullopt;
      default:
        return std::nullopt;
    }
  }

  std::string_view mText;
  size_t mPos = 0;
};

}  // namespace

std::optional<Value> ParseTextPropertyList(std::string_view text) {
  if (text.size() > kMaxFileSize) return std::nullopt;
  std::optional<std::string> converted;
  if (text.starts_with("\xEF\xBB\xBF")) {
    text.remove_prefix(3);
  } else if (text.starts_with("\xFF\xFE") || text.starts_with("\xFE\xFF")) {
    converted = Utf16ToUtf8(text.substr(2), text[0] == '\xFE');
    if (!converted) return std::nullopt;
    text = *converted;
  }
  return TextReader(text).readDocument();
}

}  // namespace plist
