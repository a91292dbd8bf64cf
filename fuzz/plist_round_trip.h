// The checks the property-list targets share: what a reader accepts has an XML form (when XML
// can hold it) and a text form that read back as the same value. Both forms write dates to
// the whole second, so values are compared with their dates so rounded.
#pragma once

#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <optional>
#include <string>
#include <string_view>

#include "plist/codec.h"

namespace tarvod::fuzz {

inline plist::Value WholeSeconds(const plist::Value& value) {
  switch (value.kind()) {
    case plist::Value::Kind::kDate:
      return plist::Value::FromDate(plist::Date{std::floor(value.date().secondsSince2001)});
    case plist::Value::Kind::kArray: {
      plist::Array array;
      for (const plist::Value& item : value.array()) array.push_back(WholeSeconds(item));
      return plist::Value(std::move(array));
    }
    case plist::Value::Kind::kDictionary: {
      plist::Dictionary dictionary;
      for (const auto& [key, item] : value.dictionary()) dictionary.set(key, WholeSeconds(item));
      return plist::Value(std::move(dictionary));
    }
    default:
      return value;
  }
}

[[noreturn]] inline void Fail(const char* what, const plist::Value& value) {
  std::fprintf(stderr, "%s: %s\n", what, plist::Describe(value).c_str());
  std::abort();
}

inline void CheckXmlRoundTrip(const plist::Value& value) {
  const std::optional<std::string> xml = plist::WriteXmlPropertyList(value);
  if (!xml) return;  // a value XML cannot hold (NUL in a string, for instance)
  const std::optional<plist::Value> back = plist::ReadPropertyList(*xml);
  if (!back) Fail("written XML does not read back", value);
  if (!(*back == WholeSeconds(value))) Fail("XML reads back as another value", value);
  if (plist::WriteXmlPropertyList(*back) != xml) Fail("XML writes differently twice", value);
}

// The old-style text form: Describe's output reads back as the same value.
inline void CheckTextRoundTrip(const plist::Value& value) {
  const std::optional<plist::Value> back = plist::ParseTextPropertyList(plist::Describe(value));
  if (!back) Fail("described text does not read back", value);
  if (!(*back == WholeSeconds(value))) Fail("described text reads back as another value", value);
}

// Reads bytes with the auto-detecting reader (XML or binary) and checks both round trips of
// whatever it accepts.
inline void CheckReadPropertyList(const uint8_t* data, size_t size) {
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  if (const std::optional<plist::Value> value = plist::ReadPropertyList(bytes)) {
    CheckXmlRoundTrip(*value);
    CheckTextRoundTrip(*value);
  }
}

}  // namespace tarvod::fuzz
