#include "plist/value.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <ctime>
#include <limits>
#include <unordered_map>

namespace plist {

namespace internal {
DictionaryBox::DictionaryBox() : p_(std::make_unique<Dictionary>()) {}
DictionaryBox::DictionaryBox(Dictionary d) : p_(std::make_unique<Dictionary>(std::move(d))) {}
DictionaryBox::DictionaryBox(const DictionaryBox& other)
    : p_(std::make_unique<Dictionary>(*other.p_)) {}
DictionaryBox::DictionaryBox(DictionaryBox&& other) noexcept
    : p_(std::exchange(other.p_, nullptr)) {
  if (!p_) p_ = std::make_unique<Dictionary>();
}
DictionaryBox& DictionaryBox::operator=(const DictionaryBox& other) {
  if (this != &other) p_ = std::make_unique<Dictionary>(*other.p_);
  return *this;
}
DictionaryBox& DictionaryBox::operator=(DictionaryBox&& other) noexcept {
  std::swap(p_, other.p_);
  return *this;
}
DictionaryBox::~DictionaryBox() = default;
bool DictionaryBox::operator==(const DictionaryBox& other) const { return *p_ == *other.p_; }
}  // namespace internal

Value::Value(Dictionary d) : v_(internal::DictionaryBox(std::move(d))) {}

const Dictionary* Value::asDictionary() const {
  auto* box = std::get_if<internal::DictionaryBox>(&v_);
  return box ? &box->get() : nullptr;
}
Dictionary* Value::asDictionary() {
  auto* box = std::get_if<internal::DictionaryBox>(&v_);
  return box ? &box->get() : nullptr;
}
const Dictionary& Value::dictionary() const { return std::get<internal::DictionaryBox>(v_).get(); }
Dictionary& Value::dictionary() { return std::get<internal::DictionaryBox>(v_).get(); }

namespace {

// White space and line breaks beyond ASCII, in UTF-8: the Unicode space separators, the
// next-line character and the line and paragraph separators.
constexpr std::string_view kUnicodeSpaces[] = {
    "\u0085", "\u00a0", "\u1680", "\u2000", "\u2001", "\u2002", "\u2003",
    "\u2004", "\u2005", "\u2006", "\u2007", "\u2008", "\u2009", "\u200a",
    "\u2028", "\u2029", "\u202f", "\u205f", "\u3000",
};

bool IsDigit(char c) { return c >= '0' && c <= '9'; }
bool IsAsciiSpace(char c) { return c == ' ' || (c >= '\t' && c <= '\r'); }

// Where the text starts once its leading white space is skipped.
size_t SkipSpace(std::string_view text) {
  size_t i = 0;
  while (const size_t length = SpaceLength(text.substr(i), false)) i += length;
  return i;
}

// The decimal exponent of the first significant digit of a number text that from_chars found
// out of range ("0.00123e-400" gives -403): with it, overflow and underflow are told apart
// by the value the text spells rather than by how the exponent is written.
int64_t DecimalExponent(std::string_view text) {
  size_t i = 0;
  if (i < text.size() && (text[i] == '+' || text[i] == '-')) ++i;
  int64_t position = 0;
  bool significant = false;
  for (; i < text.size() && IsDigit(text[i]); ++i) {
    if (significant) {
      ++position;
    } else if (text[i] != '0') {
      significant = true;
    }
  }
  if (i < text.size() && text[i] == '.') {
    int64_t place = 0;
    for (++i; i < text.size() && IsDigit(text[i]); ++i) {
      --place;
      if (!significant && text[i] != '0') {
        significant = true;
        position = place;
      }
    }
  }
  int64_t exponent = 0;
  if (i < text.size() && (text[i] == 'e' || text[i] == 'E')) {
    ++i;
    const bool negative = i < text.size() && text[i] == '-';
    if (i < text.size() && (text[i] == '+' || text[i] == '-')) ++i;
    // Saturates far beyond any double's range, long before int64 would overflow.
    for (; i < text.size() && IsDigit(text[i]); ++i) {
      if (exponent < 1'000'000'000) exponent = exponent * 10 + (text[i] - '0');
    }
    if (negative) exponent = -exponent;
  }
  return position + exponent;
}

int64_t ClampToInt64(double d) {
  if (std::isnan(d)) return 0;
  if (d >= 9223372036854775807.0) return std::numeric_limits<int64_t>::max();
  if (d <= -9223372036854775808.0) return std::numeric_limits<int64_t>::min();
  return static_cast<int64_t>(d);
}

}  // namespace

size_t SpaceLength(std::string_view text, bool atEnd) {
  if (text.empty()) return 0;
  if (IsAsciiSpace(atEnd ? text.back() : text.front())) return 1;
  for (const std::string_view space : kUnicodeSpaces) {
    if (atEnd ? text.ends_with(space) : text.starts_with(space)) return space.size();
  }
  return 0;
}

std::string_view TrimSpace(std::string_view text) {
  while (const size_t length = SpaceLength(text, false)) text.remove_prefix(length);
  while (const size_t length = SpaceLength(text, true)) text.remove_suffix(length);
  return text;
}

double LeadingNumber(std::string_view text) {
  size_t i = SkipSpace(text);
  const size_t start = i;
  if (i < text.size() && (text[i] == '+' || text[i] == '-')) ++i;
  size_t digits = 0;
  while (i < text.size() && IsDigit(text[i])) ++i, ++digits;
  if (i < text.size() && text[i] == '.') {
    ++i;
    while (i < text.size() && IsDigit(text[i])) ++i, ++digits;
  }
  if (digits == 0) return 0.0;
  if (i < text.size() && (text[i] == 'e' || text[i] == 'E')) {
    size_t j = i + 1;
    if (j < text.size() && (text[j] == '+' || text[j] == '-')) ++j;
    if (j < text.size() && IsDigit(text[j])) {
      while (j < text.size() && IsDigit(text[j])) ++j;
      i = j;
    }
  }
  // from_chars does not take a leading '+'.
  size_t from = start;
  if (text[from] == '+') ++from;
  double result = 0;
  auto [ptr, ec] = std::from_chars(text.data() + from, text.data() + i, result);
  if (ec == std::errc::result_out_of_range) {
    // Overflow reads as infinity of the right sign, underflow as zero. Every value from the
    // smallest subnormal up to the largest double is in range, so a first significant digit
    // at 10^0 or above means overflow.
    const bool negative = text[from] == '-';
    if (DecimalExponent(text.substr(from, i - from)) < 0) return negative ? -0.0 : 0.0;
    return negative ? -std::numeric_limits<double>::infinity()
                    : std::numeric_limits<double>::infinity();
  }
  (void)ptr;
  return result;
}

int64_t LeadingInteger(std::string_view text) {
  size_t i = SkipSpace(text);
  bool negative = false;
  if (i < text.size() && (text[i] == '+' || text[i] == '-')) negative = text[i++] == '-';
  uint64_t magnitude = 0;
  bool overflow = false;
  for (; i < text.size() && IsDigit(text[i]); ++i) {
    const uint64_t digit = static_cast<uint64_t>(text[i] - '0');
    if (magnitude > (std::numeric_limits<uint64_t>::max() - digit) / 10) {
      overflow = true;
    } else {
      magnitude = magnitude * 10 + digit;
    }
  }
  const uint64_t limit = negative ? uint64_t{1} << 63 : (uint64_t{1} << 63) - 1;
  if (overflow || magnitude > limit) {
    return negative ? std::numeric_limits<int64_t>::min() : std::numeric_limits<int64_t>::max();
  }
  return negative ? static_cast<int64_t>(0 - magnitude) : static_cast<int64_t>(magnitude);
}

double Value::numberValue() const {
  switch (kind()) {
    case Kind::kInteger:
      return static_cast<double>(integer());
    case Kind::kReal:
      return real();
    case Kind::kBoolean:
      return boolean() ? 1.0 : 0.0;
    case Kind::kDate:
      return date().secondsSince2001;
    case Kind::kString:
      return LeadingNumber(string());
    default:
      return 0.0;
  }
}

int64_t Value::integerValue() const {
  switch (kind()) {
    case Kind::kInteger:
      return integer();
    case Kind::kReal:
      return ClampToInt64(real());
    case Kind::kBoolean:
      return boolean() ? 1 : 0;
    case Kind::kDate:
      return ClampToInt64(date().secondsSince2001);
    case Kind::kString:
      return LeadingInteger(string());
    default:
      return 0;
  }
}

bool Value::boolValue() const {
  switch (kind()) {
    case Kind::kBoolean:
      return boolean();
    case Kind::kInteger:
      return integer() != 0;
    case Kind::kReal:
      return real() != 0.0;
    case Kind::kString: {
      const std::string& s = string();
      const size_t i = SkipSpace(s);
      if (i < s.size() && (s[i] == 'Y' || s[i] == 'y' || s[i] == 'T' || s[i] == 't')) return true;
      return LeadingInteger(s) != 0;
    }
    default:
      return false;
  }
}

bool Value::operator==(const Value& other) const {
  if (kind() != other.kind()) return false;
  switch (kind()) {
    case Kind::kDictionary:
      return dictionary() == other.dictionary();
    case Kind::kReal:
      return real() == other.real() || (std::isnan(real()) && std::isnan(other.real()));
    default:
      return v_ == other.v_;
  }
}

Dictionary::Dictionary(std::initializer_list<Entry> entries) {
  for (const auto& [key, value] : entries) set(key, value);
}

// Up to this many entries, FromEntries finds repeated keys without a hash table.
constexpr size_t kLinearFromEntries = 16;

Dictionary Dictionary::FromEntries(std::vector<Entry> entries) {
  Dictionary result;
  result.entries_.reserve(entries.size());
  if (entries.size() <= kLinearFromEntries) {
    // Few keys (every usual event): looking back through them costs less than a hash table.
    for (auto& entry : entries) {
      Value* taken = result.find(entry.first);
      if (taken) {
        *taken = std::move(entry.second);
      } else {
        result.entries_.emplace_back(std::move(entry.first), std::move(entry.second));
      }
    }
    return result;
  }
  // Positions of the keys already taken. The views point into result.entries_, whose storage
  // was reserved above and so never moves.
  std::unordered_map<std::string_view, size_t> positions;
  positions.reserve(entries.size());
  for (auto& entry : entries) {
    auto it = positions.find(entry.first);
    if (it != positions.end()) {
      result.entries_[it->second].second = std::move(entry.second);
      continue;
    }
    result.entries_.emplace_back(std::move(entry.first), std::move(entry.second));
    positions.emplace(result.entries_.back().first, result.entries_.size() - 1);
  }
  return result;
}

const Value* Dictionary::find(std::string_view key) const {
  for (const auto& entry : entries_) {
    if (entry.first == key) return &entry.second;
  }
  return nullptr;
}

Value* Dictionary::find(std::string_view key) {
  for (auto& entry : entries_) {
    if (entry.first == key) return &entry.second;
  }
  return nullptr;
}

const std::string* Dictionary::findString(std::string_view key) const {
  const Value* v = find(key);
  return v ? v->asString() : nullptr;
}
const Array* Dictionary::findArray(std::string_view key) const {
  const Value* v = find(key);
  return v ? v->asArray() : nullptr;
}
const Dictionary* Dictionary::findDictionary(std::string_view key) const {
  const Value* v = find(key);
  return v ? v->asDictionary() : nullptr;
}
Dictionary* Dictionary::findDictionary(std::string_view key) {
  Value* v = find(key);
  return v ? v->asDictionary() : nullptr;
}

void Dictionary::set(std::string_view key, Value value) {
  if (Value* existing = find(key)) {
    *existing = std::move(value);
    return;
  }
  entries_.emplace_back(std::string(key), std::move(value));
}

bool Dictionary::erase(std::string_view key) {
  auto it = std::find_if(entries_.begin(), entries_.end(),
                         [&](const Entry& e) { return e.first == key; });
  if (it == entries_.end()) return false;
  entries_.erase(it);
  return true;
}

std::vector<std::string> Dictionary::sortedKeys() const {
  std::vector<std::string> keys;
  keys.reserve(entries_.size());
  for (const auto& entry : entries_) keys.push_back(entry.first);
  std::sort(keys.begin(), keys.end());
  return keys;
}

bool IsFormattableDate(Date date) {
  const double seconds = std::floor(date.secondsSince2001) + kUnixTimeOfReferenceDate;
  // 0001-01-01 00:00:00 to 9999-12-31 23:59:59 UTC, in Unix seconds; NaN fails both.
  return seconds >= -62135596800.0 && seconds <= 253402300799.0;
}

std::string FormatDate(Date date, bool localTime) {
  // Whole seconds since 2001 first, as the XML writer takes them: the shift to 1970 would
  // round away a fraction too small for its magnitude (-1e-9 would show as 00:00:00).
  double seconds = std::floor(date.secondsSince2001) + kUnixTimeOfReferenceDate;
  if (!IsFormattableDate(date)) seconds = kUnixTimeOfReferenceDate;
  const time_t t = static_cast<time_t>(seconds);
  struct tm tm {};
  if (localTime) {
    localtime_r(&t, &tm);
  } else {
    gmtime_r(&t, &tm);
  }
  const long offset = localTime ? tm.tm_gmtoff : 0;
  const long absOffset = offset < 0 ? -offset : offset;
  char buffer[64];
  std::snprintf(buffer, sizeof buffer, "%04d-%02d-%02d %02d:%02d:%02d %c%02ld%02ld",
                tm.tm_year + 1900, tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec,
                offset < 0 ? '-' : '+', absOffset / 3600, (absOffset % 3600) / 60);
  return buffer;
}

namespace {

// Days from 1970-01-01 to a date of the proleptic Gregorian calendar.
int64_t DaysFromCivil(int64_t year, int month, int day) {
  year -= month <= 2 ? 1 : 0;
  const int64_t era = (year >= 0 ? year : year - 399) / 400;
  const int64_t yearOfEra = year - era * 400;
  const int64_t dayOfYear = (153 * (month + (month > 2 ? -3 : 9)) + 2) / 5 + day - 1;
  const int64_t dayOfEra = yearOfEra * 365 + yearOfEra / 4 - yearOfEra / 100 + dayOfYear;
  return era * 146097 + dayOfEra - 719468;
}

bool IsLeapYear(int year) { return year % 4 == 0 && (year % 100 != 0 || year % 400 == 0); }

int DaysInMonth(int year, int month) {
  static const int kDays[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
  return month == 2 && IsLeapYear(year) ? 29 : kDays[month - 1];
}

// Reads exactly `count` decimal digits at `text[at]`; -1 when they are not all digits.
int FixedDigits(std::string_view text, size_t at, size_t count) {
  int result = 0;
  for (size_t i = at; i < at + count; ++i) {
    if (i >= text.size() || !IsDigit(text[i])) return -1;
    result = result * 10 + (text[i] - '0');
  }
  return result;
}

}  // namespace

std::optional<Date> ParseDate(std::string_view text) {
  // "YYYY-MM-DD HH:MM:SS +HHMM" or "YYYY-MM-DDTHH:MM:SSZ"
  const bool formatted = text.size() == 25 && text[10] == ' ' && text[19] == ' ' &&
                         (text[20] == '+' || text[20] == '-');
  const bool xml = text.size() == 20 && text[10] == 'T' && text[19] == 'Z';
  if (!formatted && !xml) return std::nullopt;
  if (text[4] != '-' || text[7] != '-' || text[13] != ':' || text[16] != ':') return std::nullopt;
  const int year = FixedDigits(text, 0, 4);
  const int month = FixedDigits(text, 5, 2);
  const int day = FixedDigits(text, 8, 2);
  const int hour = FixedDigits(text, 11, 2);
  const int minute = FixedDigits(text, 14, 2);
  const int second = FixedDigits(text, 17, 2);
  if (year < 1 || month < 1 || month > 12 || day < 1 || day > DaysInMonth(year, month) ||
      hour < 0 || hour > 23 || minute < 0 || minute > 59 || second < 0 || second > 59) {
    return std::nullopt;
  }
  int64_t offset = 0;
  if (formatted) {
    const int offsetHours = FixedDigits(text, 21, 2);
    const int offsetMinutes = FixedDigits(text, 23, 2);
    if (offsetHours < 0 || offsetHours > 23 || offsetMinutes < 0 || offsetMinutes > 59) {
      return std::nullopt;
    }
    offset = (offsetHours * 3600 + offsetMinutes * 60) * (text[20] == '-' ? -1 : 1);
  }
  const int64_t unixSeconds =
      DaysFromCivil(year, month, day) * 86400 + hour * 3600 + minute * 60 + second - offset;
  return Date{static_cast<double>(unixSeconds) - kUnixTimeOfReferenceDate};
}

bool IsValidUtf8(std::string_view text) {
  const auto* bytes = reinterpret_cast<const unsigned char*>(text.data());
  const size_t size = text.size();
  size_t i = 0;
  while (i < size) {
    const unsigned char lead = bytes[i];
    if (lead < 0x80) {
      ++i;
      continue;
    }
    size_t length;
    unsigned char low = 0x80, high = 0xBF;  // the range of the second byte
    if (lead >= 0xC2 && lead <= 0xDF) {
      length = 2;
    } else if (lead >= 0xE0 && lead <= 0xEF) {
      length = 3;
      if (lead == 0xE0) low = 0xA0;   // overlong
      if (lead == 0xED) high = 0x9F;  // surrogates
    } else if (lead >= 0xF0 && lead <= 0xF4) {
      length = 4;
      if (lead == 0xF0) low = 0x90;   // overlong
      if (lead == 0xF4) high = 0x8F;  // above U+10FFFF
    } else {
      return false;
    }
    if (size - i < length) return false;
    if (bytes[i + 1] < low || bytes[i + 1] > high) return false;
    for (size_t k = 2; k < length; ++k) {
      if (bytes[i + k] < 0x80 || bytes[i + k] > 0xBF) return false;
    }
    i += length;
  }
  return true;
}

namespace {

std::string FormatReal(double d) {
  if (std::isnan(d)) return "nan";
  if (std::isinf(d)) return d < 0 ? "-inf" : "inf";
  char buffer[64];
  auto [ptr, ec] = std::to_chars(buffer, buffer + sizeof buffer, d);
  return std::string(buffer, ec == std::errc() ? ptr : buffer);
}

std::string FormatData(const Data& data) {
  static const char kHex[] = "0123456789abcdef";
  std::string out = "<";
  for (size_t i = 0; i < data.size(); ++i) {
    if (i > 0 && i % 4 == 0) out += ' ';
    out += kHex[data[i] >> 4];
    out += kHex[data[i] & 0xF];
  }
  out += '>';
  return out;
}

bool IsWordStart(char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || c == '_' || c == '$' || c == '/';
}
bool IsWordChar(char c) { return IsWordStart(c) || IsDigit(c) || c == '.' || c == '-' || c == ':'; }

// A string is written bare only when the reader cannot take it for anything else.
bool IsPlainWord(const std::string& s) {
  if (s.empty() || !IsWordStart(s[0])) return false;
  if (s == "true" || s == "false" || s == "nan" || s == "inf") return false;
  // "//" and "/*" would start a comment where a value is expected.
  if (s.starts_with("//")) return false;
  // The binary property list's magic would make the whole text read back as a binary list.
  if (s.starts_with("bplist")) return false;
  return std::all_of(s.begin(), s.end(), IsWordChar);
}

void AppendQuoted(std::string& out, const std::string& s) {
  if (IsPlainWord(s)) {
    out += s;
    return;
  }
  AppendEscapedString(out, s);
}

void AppendIndent(std::string& out, int depth) { out.append(static_cast<size_t>(depth) * 4, ' '); }

// Iterative over containers would need an explicit stack; values built by our readers are
// bounded in depth (see codec.h), so plain recursion is safe here.
void AppendDescription(std::string& out, const Value& value, int depth) {
  switch (value.kind()) {
    case Value::Kind::kString:
      AppendQuoted(out, value.string());
      break;
    case Value::Kind::kInteger:
      out += std::to_string(value.integer());
      break;
    case Value::Kind::kReal: {
      const double d = value.real();
      if (!std::isfinite(d)) {
        out += "<*R" + FormatReal(d) + ">";
      } else {
        std::string text = FormatReal(d);
        if (text.find_first_of(".e") == std::string::npos) text += ".0";
        out += text;
      }
      break;
    }
    case Value::Kind::kBoolean:
      out += value.boolean() ? "true" : "false";
      break;
    case Value::Kind::kDate:
      out += "<*D" + FormatDate(value.date(), false) + ">";
      break;
    case Value::Kind::kData:
      out += FormatData(value.data());
      break;
    case Value::Kind::kArray: {
      const Array& array = value.array();
      if (array.empty()) {
        out += "()";
        break;
      }
      out += "(\n";
      for (size_t i = 0; i < array.size(); ++i) {
        AppendIndent(out, depth + 1);
        AppendDescription(out, array[i], depth + 1);
        out += i + 1 < array.size() ? ",\n" : "\n";
      }
      AppendIndent(out, depth);
      out += ')';
      break;
    }
    case Value::Kind::kDictionary: {
      const Dictionary& dictionary = value.dictionary();
      if (dictionary.empty()) {
        out += "{}";
        break;
      }
      out += "{\n";
      for (const auto& [key, item] : dictionary) {
        AppendIndent(out, depth + 1);
        AppendQuoted(out, key);
        out += " = ";
        AppendDescription(out, item, depth + 1);
        out += ";\n";
      }
      AppendIndent(out, depth);
      out += '}';
      break;
    }
  }
}

}  // namespace

void AppendEscapedString(std::string& out, std::string_view text) {
  out += '"';
  // Runs of characters that need no escape are appended whole.
  static constexpr auto kPlain = [] {
    std::array<bool, 256> plain{};
    for (int u = 0x20; u < 256; ++u) plain[u] = u != 0x7F && u != '"' && u != '\\';
    return plain;
  }();
  const auto plain = [](char c) { return kPlain[static_cast<unsigned char>(c)]; };
  while (!text.empty()) {
    size_t run = 0;
    while (run < text.size() && plain(text[run])) ++run;
    out.append(text.data(), run);
    text.remove_prefix(run);
    if (text.empty()) break;
    const char c = text.front();
    text.remove_prefix(1);
    const auto u = static_cast<unsigned char>(c);
    switch (c) {
      case '"':
        out += "\\\"";
        break;
      case '\\':
        out += "\\\\";
        break;
      case '\n':
        out += "\\n";
        break;
      case '\t':
        out += "\\t";
        break;
      case '\r':
        out += "\\r";
        break;
      default:
        if (u < 0x20 || u == 0x7F) {
          char buffer[8];
          std::snprintf(buffer, sizeof buffer, "\\u%04x", u);
          out += buffer;
        } else {
          out += c;
        }
    }
  }
  out += '"';
}

std::string Describe(const Value& value) {
  std::string out;
  AppendDescription(out, value, 0);
  return out;
}

std::string Describe(const Dictionary& dictionary) {
  // Copying would double the cost of every event print; wrap without copying instead.
  std::string out;
  if (dictionary.empty()) return "{}";
  out += "{\n";
  for (const auto& [key, item] : dictionary) {
    AppendIndent(out, 1);
    AppendQuoted(out, key);
    out += " = ";
    AppendDescription(out, item, 1);
    out += ";\n";
  }
  out += '}';
  return out;
}

const char* KindName(const Value& value) {
  if (value.isString()) return "string";
  if (value.isBoolean()) return "boolean";
  if (value.isInteger()) return "integer";
  if (value.isNumber()) return "real";
  if (value.isArray()) return "array";
  if (value.isDictionary()) return "dictionary";
  if (value.isDate()) return "date";
  return "data";
}

std::string Value::textForm() const {
  switch (kind()) {
    case Kind::kString:
      return string();
    case Kind::kInteger:
      return std::to_string(integer());
    case Kind::kReal:
      return FormatReal(real());
    case Kind::kBoolean:
      return boolean() ? "true" : "false";
    case Kind::kDate:
      return FormatDate(date(), false);
    default:
      return Describe(*this);
  }
}

}  // namespace plist
