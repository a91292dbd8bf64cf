// The property-list value model: string, integer, real, boolean, date, data, array and
// dictionary. Values are plain C++ values (copying copies the whole tree); containers that
// several owners share are held by std::shared_ptr where they are owned. Thread-compatible:
// a value may be read from several threads at once, written from one.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

namespace plist {

// Seconds since 2001-01-01 00:00:00 UTC, the reference date of every timestamp in the daemon.
struct Date {
  double secondsSince2001 = 0;
  bool operator==(const Date&) const = default;
};
inline constexpr double kUnixTimeOfReferenceDate = 978307200.0;

using Data = std::vector<uint8_t>;

class Value;
class Dictionary;
using Array = std::vector<Value>;

namespace internal {
// Owns a Dictionary that is incomplete where Value is declared; copies deeply.
class DictionaryBox {
 public:
  DictionaryBox();
  explicit DictionaryBox(Dictionary d);
  DictionaryBox(const DictionaryBox& other);
  DictionaryBox(DictionaryBox&&) noexcept;
  DictionaryBox& operator=(const DictionaryBox& other);
  DictionaryBox& operator=(DictionaryBox&&) noexcept;
  ~DictionaryBox();
  Dictionary& get() { return *p_; }
  const Dictionary& get() const { return *p_; }
  bool operator==(const DictionaryBox& other) const;

 private:
  std::unique_ptr<Dictionary> p_;
};
}  // namespace internal

class Value {
 public:
  enum class Kind { kString, kInteger, kReal, kBoolean, kDate, kData, kArray, kDictionary };

  Value() : v_(std::string()) {}  // the empty string
  Value(std::string s) : v_(std::move(s)) {}
  Value(std::string_view s) : v_(std::string(s)) {}
  Value(const char* s) : v_(std::string(s)) {}
  Value(Array a) : v_(std::move(a)) {}
  Value(Dictionary d);
  static Value Integer(int64_t i) { return Value(Tag{}, i); }
  static Value Real(double d) { return Value(Tag{}, d); }
  static Value Boolean(bool b) { return Value(Tag{}, b); }
  static Value FromDate(Date d) { return Value(Tag{}, d); }
  static Value FromData(Data d) { return Value(Tag{}, std::move(d)); }

  Kind kind() const { return static_cast<Kind>(v_.index()); }
  bool isString() const { return kind() == Kind::kString; }
  bool isInteger() const { return kind() == Kind::kInteger; }
  bool isReal() const { return kind() == Kind::kReal; }
  bool isBoolean() const { return kind() == Kind::kBoolean; }
  bool isDate() const { return kind() == Kind::kDate; }
  bool isData() const { return kind() == Kind::kData; }
  bool isArray() const { return kind() == Kind::kArray; }
  bool isDictionary() const { return kind() == Kind::kDictionary; }
  // Integers, reals and booleans: the kinds that compare and convert as numbers.
  bool isNumber() const { return isInteger() || isReal() || isBoolean(); }

  // Typed access; nullptr when the value is of another kind.
  const std::string* asString() const { return std::get_if<std::string>(&v_); }
  std::string* asString() { return std::get_if<std::string>(&v_); }
  const Array* asArray() const { return std::get_if<Array>(&v_); }
  Array* asArray() { return std::get_if<Array>(&v_); }
  const Dictionary* asDictionary() const;
  Dictionary* asDictionary();
  const Data* asData() const { return std::get_if<Data>(&v_); }

  // Unchecked access: the kind must match.
  const std::string& string() const { return std::get<std::string>(v_); }
  int64_t integer() const { return std::get<int64_t>(v_); }
  double real() const { return std::get<double>(v_); }
  bool boolean() const { return std::get<bool>(v_); }
  Date date() const { return std::get<Date>(v_); }
  const Data& data() const { return std::get<Data>(v_); }
  const Array& array() const { return std::get<Array>(v_); }
  Array& array() { return std::get<Array>(v_); }
  const Dictionary& dictionary() const;
  Dictionary& dictionary();

  // The numeric value: a number as a double (true is 1), a date as its seconds since 2001,
  // a string's leading decimal number after white space (sign, digits, fraction, exponent;
  // 0 when there is none); 0 for data, arrays and dictionaries.
  double numberValue() const;
  // The integer value: a number truncated toward zero (clamped to the 64-bit range), a
  // string's leading integer after white space (sign and digits only); 0 otherwise.
  int64_t integerValue() const;
  // The boolean value: a boolean itself, a number when non-zero, a string whose integer value
  // is non-zero or that begins with Y, y, T or t; false otherwise.
  bool boolValue() const;

  // The value's text form: a string is itself; every other value is its description.
  std::string textForm() const;

  bool operator==(const Value& other) const;

 private:
  struct Tag {};
  Value(Tag, int64_t i) : v_(i) {}
  Value(Tag, double d) : v_(d) {}
  Value(Tag, bool b) : v_(b) {}
  Value(Tag, Date d) : v_(d) {}
  Value(Tag, Data d) : v_(std::move(d)) {}

  std::variant<std::string, int64_t, double, bool, Date, Data, Array, internal::DictionaryBox> v_;
};

// A dictionary with string keys that keeps its keys in insertion order.
class Dictionary {
 public:
  using Entry = std::pair<std::string, Value>;

  Dictionary() = default;
  Dictionary(std::initializer_list<Entry> entries);
  // Builds a dictionary from entries in their order; a key that repeats replaces the earlier
  // value in place, as set does. Linear in the number of entries, so readers of untrusted
  // input use it rather than repeated set calls.
  static Dictionary FromEntries(std::vector<Entry> entries);

  size_t size() const { return entries_.size(); }
  bool empty() const { return entries_.empty(); }
  auto begin() const { return entries_.begin(); }
  auto end() const { return entries_.end(); }
  auto begin() { return entries_.begin(); }
  auto end() { return entries_.end(); }

  const Value* find(std::string_view key) const;
  Value* find(std::string_view key);
  bool contains(std::string_view key) const { return find(key) != nullptr; }
  // Typed look-ups; nullptr when the key is absent or holds another kind.
  const std::string* findString(std::string_view key) const;
  const Array* findArray(std::string_view key) const;
  const Dictionary* findDictionary(std::string_view key) const;
  Dictionary* findDictionary(std::string_view key);

  // Replaces the value of an existing key in place, or appends the key.
  void set(std::string_view key, Value value);
  // Room for n entries, so that n - size() new keys can be set without moving the others.
  void reserve(size_t n) { entries_.reserve(n); }
  bool erase(std::string_view key);
  void clear() { entries_.clear(); }
  // The keys in ascending order of their bytes (the order assignments are made in).
  std::vector<std::string> sortedKeys() const;

  bool operator==(const Dictionary& other) const { return entries_ == other.entries_; }

 private:
  std::vector<Entry> entries_;
};

// The kind of value as a word: "string", "boolean", "integer", "real", "array", "dictionary",
// "date" or "data".
const char* KindName(const Value& value);

// The old-style text form ("{ key = value; }", "( a, b )") of a value: strings are quoted
// unless they are plain words, nested containers are indented by four blanks per level.
// This is what every message prints for a value, and what ReadPropertyList reads back.
std::string Describe(const Value& value);
std::string Describe(const Dictionary& dictionary);

// Appends text between double quotes, escaping '"', '\\', line feed, tab and carriage return
// with a backslash and other control characters as \u00XX: a form that both the old-style
// text reader and JSON read back.
void AppendEscapedString(std::string& out, std::string_view text);

// Whether FormatDate can show the date: a finite time in the years 1 to 9999 (UTC).
bool IsFormattableDate(Date date);
// Formats a date as "YYYY-MM-DD HH:MM:SS +HHMM" in the given zone (local time when true); a
// date that is not formattable shows as the reference date.
std::string FormatDate(Date date, bool localTime);
// Reads a date back from FormatDate's form ("YYYY-MM-DD HH:MM:SS +HHMM", any zone offset) or
// from the XML property-list form ("YYYY-MM-DDTHH:MM:SSZ"); years 1 to 9999. nullopt when the
// text is neither.
std::optional<Date> ParseDate(std::string_view text);

// Whether the bytes are well-formed UTF-8 (no overlong forms, surrogates or code points above
// U+10FFFF). Every string a reader returns has passed this test.
bool IsValidUtf8(std::string_view text);

// Byte length of the white space or line break that text begins with (ends with, when
// atEnd), 0 when there is none: ASCII blanks and controls \t to \r, and in UTF-8 the Unicode
// space separators, the next-line character and the line and paragraph separators.
size_t SpaceLength(std::string_view text, bool atEnd);
// text without the white space and line breaks at either end.
std::string_view TrimSpace(std::string_view text);

// The leading decimal number / integer of a text, as numberValue and integerValue read it,
// after leading white space. A number too large for a double reads as infinity of its sign,
// one too small as zero of its sign.
double LeadingNumber(std::string_view text);
int64_t LeadingInteger(std::string_view text);

}  // namespace plist
