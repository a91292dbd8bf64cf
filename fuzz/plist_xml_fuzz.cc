// XML property lists: any bytes through the reader; what it accepts round-trips through the
// XML writer and the text form.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "plist_round_trip.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  const std::optional<plist::Value> value = plist::ReadPropertyList(bytes);
  if (value) {
    tarvod::fuzz::CheckXmlRoundTrip(*value);
    tarvod::fuzz::CheckTextRoundTrip(*value);
  }
  return 0;
}
