// XML property lists: any bytes through the reader; what it accepts round-trips through the
// XML writer and the text form.
#include <cstddef>
#include <cstdint>

#include "plist_round_trip.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  tarvod::fuzz::CheckReadPropertyList(data, size);
  return 0;
}
