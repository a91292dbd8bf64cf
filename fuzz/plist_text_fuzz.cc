// The old-style text form (and ".strings" tables): what the reader accepts is described as
// text that reads back as the same value, and written as XML that does too.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "plist_round_trip.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  const std::optional<plist::Value> value = plist::ParseTextPropertyList(bytes);
  if (value) {
    tarvod::fuzz::CheckTextRoundTrip(*value);
    tarvod::fuzz::CheckXmlRoundTrip(*value);
  }
  return 0;
}
