// Shared by the fuzz targets: a reader that turns the fuzzer's bytes into choices, and a
// property-list value built from them. Every choice reads as something once the bytes run
// out, so any input builds a value.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <initializer_list>
#include <string>
#include <string_view>

#include "plist/value.h"

namespace tarvod::fuzz {

class ByteReader {
 public:
  ByteReader(const uint8_t* data, size_t size) : mData(data), mSize(size) {}

  bool empty() const { return mPos >= mSize; }
  uint8_t byte() { return empty() ? 0 : mData[mPos++]; }
  uint64_t integer(size_t bytes) {
    uint64_t value = 0;
    for (size_t i = 0; i < bytes; ++i) value = value << 8 | byte();
    return value;
  }
  // A length byte, then that many bytes (fewer at the end of the input).
  std::string text() {
    const size_t length = byte();  // before the rest is measured
    const size_t taken = std::min(length, mSize - mPos);
    std::string out(reinterpret_cast<const char*>(mData + mPos), taken);
    mPos += taken;
    return out;
  }
  // One of the given texts, or (for a choice past them) text from the input.
  std::string pick(std::initializer_list<std::string_view> texts) {
    const size_t choice = byte();
    if (choice < texts.size()) return std::string(texts.begin()[choice]);
    return text();
  }

 private:
  const uint8_t* mData;
  size_t mSize;
  size_t mPos = 0;
};

// Strings the daemon gives meaning to: references to variables of each namespace, format
// suffixes, arithmetic, numbers in text and names the fuzz contexts define.
inline std::string InterestingString(ByteReader& in) {
  return in.pick({"${count}",
                  "${global:count}",
                  "${event:user}",
                  "${event:eventType}",
                  "${builtin:hostname}",
                  "${t:eventCounter}",
                  "${name}",
                  "${${name}}",
                  "${count%5.1f}",
                  "${count%x}",
                  "${when%t}",
                  "${count%m}",
                  "${list}",
                  "${missing}",
                  "3 * (2 + ${count})",
                  "1/0",
                  "5",
                  "-7",
                  "1.5e3",
                  "",
                  "root",
                  "wheel",
                  "a",
                  "A\\:b",
                  "${",
                  "}",
                  "%n",
                  "nan"});
}

// A value of any kind, nested at most `depth` containers deep.
inline plist::Value BuildValue(ByteReader& in, int depth = 4) {
  switch (in.byte() % (depth > 0 ? 9 : 7)) {
    case 0:
      return InterestingString(in);
    case 1:
      return in.text();
    case 2:
      return plist::Value::Integer(static_cast<int64_t>(in.integer(in.byte() % 9)));
    case 3: {
      const uint64_t bits = in.integer(8);
      double real;
      static_assert(sizeof real == sizeof bits);
      std::memcpy(&real, &bits, sizeof real);
      return plist::Value::Real(real);
    }
    case 4:
      return plist::Value::Boolean(in.byte() & 1);
    case 5:
      return plist::Value::FromDate(
          plist::Date{static_cast<double>(static_cast<int32_t>(in.integer(4)))});
    case 6: {
      const std::string bytes = in.text();
      return plist::Value::FromData(plist::Data(bytes.begin(), bytes.end()));
    }
    case 7: {
      plist::Array array;
      for (size_t n = in.byte() % 5; n > 0 && !in.empty(); --n) {
        array.push_back(BuildValue(in, depth - 1));
      }
      return plist::Value(std::move(array));
    }
    default: {
      plist::Dictionary dictionary;
      for (size_t n = in.byte() % 5; n > 0 && !in.empty(); --n) {
        std::string key = in.pick({"user", "eventType", "count", "name", "operator", "operands"});
        dictionary.set(key, BuildValue(in, depth - 1));
      }
      return plist::Value(std::move(dictionary));
    }
  }
}

}  // namespace tarvod::fuzz
