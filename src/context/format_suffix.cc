#include "context/format_suffix.h"

#include <cmath>
#include <cstdint>
#include <cstdio>
#include <string>
#include <vector>

#include "platform/diagnostic_log.h"

namespace tarvod {
namespace {

// A suffix is rule-file text. It is never handed to the C formatter: it is parsed here into
// literal text around exactly one conversion, and the conversion is rebuilt from the parts
// this unit understands, with one argument of the type the rebuilt conversion expects.
constexpr int kMaxWidth = 1000;
constexpr int kMaxPrecision = 100;

enum class Group { kFloat, kUnsigned, kSigned };

struct Conversion {
  std::string prefix;   // literal text before the conversion, "%%" already turned into "%"
  std::string trailer;  // literal text after it
  std::string flags;    // each flag at most once, in the order "-+ #0"
  int width = -1;       // -1: none
  int precision = -1;   // -1: none
  char conversion = 'd';
  Group group = Group::kSigned;
};

std::optional<Group> TriggerGroup(char c) {
  switch (c) {
    case 'E':
    case 'F':
    case 'G':
    case 'e':
    case 'f':
    case 'g':
      return Group::kFloat;
    case 'X':
    case 'c':
    case 'u':
    case 'x':
      return Group::kUnsigned;
    case 'd':
    case 'i':
      return Group::kSigned;
    default:
      return std::nullopt;
  }
}

bool IsDigit(char c) { return c >= '0' && c <= '9'; }

// Literal text: "%%" stands for one "%"; any other "%" would start a second conversion (or a
// "%n"), which a suffix may not hold.
std::optional<std::string> DecodeLiteral(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '%') {
      out += text[i];
    } else if (i + 1 < text.size() && text[i + 1] == '%') {
      out += '%';
      ++i;
    } else {
      return std::nullopt;
    }
  }
  return out;
}

// Digits saturating at limit, so that a width of a million digits reads as the limit.
int ReadClamped(std::string_view text, size_t& i, int limit) {
  int value = 0;
  for (; i < text.size() && IsDigit(text[i]); ++i) {
    if (value < limit) value = value * 10 + (text[i] - '0');
  }
  return value < limit ? value : limit;
}

// The first trigger character decides, as the lookup's scan does; the "%" that introduces it
// is the last one before it. Between the two only flags, a width, a precision and length
// modifiers may stand: "*" widths, "1$" positions and every other character reject the suffix.
std::optional<Conversion> ParseConversion(std::string_view suffix) {
  size_t trigger = 0;
  std::optional<Group> group;
  for (; trigger < suffix.size(); ++trigger) {
    group = TriggerGroup(suffix[trigger]);
    if (group) break;
  }
  if (!group) return std::nullopt;
  const size_t percent = suffix.rfind('%', trigger);
  if (percent == std::string_view::npos) return std::nullopt;

  Conversion result;
  result.group = *group;
  result.conversion = suffix[trigger];
  auto prefix = DecodeLiteral(suffix.substr(0, percent));
  auto trailer = DecodeLiteral(suffix.substr(trigger + 1));
  if (!prefix || !trailer) return std::nullopt;
  result.prefix = std::move(*prefix);
  result.trailer = std::move(*trailer);

  const std::string_view directive = suffix.substr(percent + 1, trigger - percent - 1);
  size_t i = 0;
  bool seen[5] = {};
  static constexpr char kFlags[] = "-+ #0";
  for (; i < directive.size(); ++i) {
    const char c = directive[i];
    if (c == '\'') continue;  // digit grouping: the daemon formats in the C locale, a no-op
    bool isFlag = false;
    for (int f = 0; f < 5; ++f) {
      if (c == kFlags[f]) {
        seen[f] = true;
        isFlag = true;
      }
    }
    if (!isFlag) break;
  }
  if (i < directive.size() && IsDigit(directive[i]))
    result.width = ReadClamped(directive, i, kMaxWidth);
  if (i < directive.size() && directive[i] == '.') {
    ++i;
    result.precision = ReadClamped(directive, i, kMaxPrecision);
  }
  // Length modifiers are read and dropped: the argument's type is chosen below.
  for (; i < directive.size(); ++i) {
    const char c = directive[i];
    if (c != 'h' && c != 'l' && c != 'L' && c != 'q' && c != 'j' && c != 'z' && c != 't') {
      return std::nullopt;
    }
  }

  // Keep only the flags whose meaning the C standard defines for this conversion.
  std::string_view allowed;
  switch (result.conversion) {
    case 'd':
    case 'i':
      allowed = "-+ 0";
      break;
    case 'u':
      allowed = "-0";
      break;
    case 'x':
    case 'X':
      allowed = "-#0";
      break;
    case 'c':
      allowed = "-";
      result.precision = -1;
      break;
    default:
      allowed = "-+ #0";
      break;
  }
  for (int f = 0; f < 5; ++f) {
    if (seen[f] && allowed.find(kFlags[f]) != std::string_view::npos) result.flags += kFlags[f];
  }
  return result;
}

// One call of the C formatter with a format built above from validated parts.
template <typename T>
std::string FormatOne(const std::string& format, T argument) {
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
  char buffer[2048];
  const int n = std::snprintf(buffer, sizeof buffer, format.c_str(), argument);
  if (n < 0) return std::string();
  if (static_cast<size_t>(n) < sizeof buffer) return std::string(buffer, static_cast<size_t>(n));
  std::vector<char> large(static_cast<size_t>(n) + 1);
  std::snprintf(large.data(), large.size(), format.c_str(), argument);
#pragma GCC diagnostic pop
  return std::string(large.data(), static_cast<size_t>(n));
}

std::string Render(const Conversion& c, const std::optional<plist::Value>& value) {
  std::string format = "%" + c.flags;
  if (c.width >= 0) format += std::to_string(c.width);
  if (c.precision >= 0) format += "." + std::to_string(c.precision);
  std::string text;
  switch (c.group) {
    case Group::kFloat:
      format += c.conversion;
      text = FormatOne(format, value ? value->numberValue() : 0.0);
      break;
    case Group::kSigned:
      format += "ll";
      format += c.conversion;
      text = FormatOne(format, static_cast<long long>(value ? value->integerValue() : 0));
      break;
    case Group::kUnsigned: {
      const auto integer = static_cast<unsigned long long>(value ? value->integerValue() : 0);
      if (c.conversion == 'c') {
        // Text values hold neither NUL bytes nor broken UTF-8: only a printable ASCII code
        // becomes a character; any other code gives no character (the width still pads).
        if (integer >= 0x20 && integer < 0x7F) {
          text = FormatOne(format + "c", static_cast<int>(integer));
        } else {
          text = FormatOne(format + "s", "");
        }
      } else {
        format += "ll";
        format += c.conversion;
        text = FormatOne(format, integer);
      }
      break;
    }
  }
  return c.prefix + text + c.trailer;
}

// Binary units (1 KB = 1024 bytes) with one decimal: "512 bytes", "1.5 KB", "3.2 GB".
std::string ByteAmount(double bytes) {
  if (!std::isfinite(bytes)) return FormatOne("%f bytes", bytes);
  static constexpr const char* kUnits[] = {"KB", "MB", "GB", "TB", "PB", "EB"};
  const double magnitude = std::fabs(bytes);
  if (magnitude < 0.5) return "0 bytes";
  if (std::round(magnitude) < 1024) return FormatOne("%.0f bytes", bytes);
  double scaled = bytes / 1024;
  size_t unit = 0;
  // Step up while the rounded figure would read 1024.0 or more.
  while (unit + 1 < std::size(kUnits) && std::round(std::fabs(scaled) * 10) >= 1024 * 10) {
    scaled /= 1024;
    ++unit;
  }
  return FormatOne("%.1f ", scaled) + kUnits[unit];
}

bool HasNoNumber(const plist::Value& value) {
  return value.isArray() || value.isDictionary() || value.isData();
}

}  // namespace

bool IsAppliedFormatSuffix(std::string_view suffix) {
  return suffix == "%t" || suffix == "%m" || ParseConversion(suffix).has_value();
}

std::optional<plist::Value> ApplyFormatSuffix(const std::optional<plist::Value>& value,
                                              std::string_view suffix) {
  // Arrays, dictionaries and data have no number to format: they come back unchanged.
  // A date reads as its seconds since 2001, so "%t" of a date is its own text form.
  if (suffix.empty() || (value && HasNoNumber(*value))) return value;
  const double number = value ? value->numberValue() : 0.0;
  // Dates are shown in UTC, like the text form of every other date the daemon writes.
  if (suffix == "%t") {
    // A date the calendar text cannot show is refused like any suffix that does not apply,
    // rather than shown as some other date.
    if (!plist::IsFormattableDate(plist::Date{number})) {
      LogMessage(1,
                 "ApplyFormatSuffix: %.17g seconds since 2001 lie outside the years 1 to 9999; "
                 "%%t not applied",
                 number);
      return value;
    }
    return plist::Value(plist::FormatDate(plist::Date{number}, false));
  }
  if (suffix == "%m") return plist::Value(ByteAmount(number));
  auto conversion = ParseConversion(suffix);
  if (!conversion) return value;
  return plist::Value(Render(*conversion, value));
}

}  // namespace tarvod
