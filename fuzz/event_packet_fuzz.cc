// One event socket packet (up to its 1 MiB limit) as the listener reads it: the property list
// it carries, and, when that is a dictionary, the event made from it for a sender.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "sources/event_listener.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > tarvod::kMaxEventMessageBytes) return 0;  // never read whole
  const std::optional<plist::Value> message =
      tarvod::ReadEventPacket({reinterpret_cast<const char*>(data), size});
  if (!message || !message->isDictionary()) return 0;
  const std::optional<plist::Dictionary> event =
      tarvod::ConvertXPCEvent(message->dictionary(), 1001, 0xFFFFFFFE);
  // The sender's IDs are added unless the message carried its own.
  if (event && (!event->contains("senderUID") || !event->contains("senderGID"))) {
    __builtin_trap();
  }
  return 0;
}
