// Binary property lists ("bplist00"), up to the event packet's 1 MiB: the reader's own checks
// of offsets, references, depth and expanded size come before libplist sees the bytes. What
// it accepts has an XML and a text form that read back as the same value. (There is no binary
// writer to round-trip through.)
#include <cstddef>
#include <cstdint>

#include "plist_round_trip.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  tarvod::fuzz::CheckReadPropertyList(data, size);
  return 0;
}
