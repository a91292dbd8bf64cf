// BSM audit records as the audit pipe delivers them, through the conversion into login events
// (ConvertAuditRecord, into a Monitor that drops what it is handed), and token by token
// through the decoder.
#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>

#include "sources/audit_pipe.h"
#include "sources/bsm.h"
#include "sources/monitor.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static tarvod::Monitor* const monitor = [] {
    tarvod::MonitorHooks hooks;
    hooks.dispatch = [](const plist::Dictionary& event) { plist::Describe(event); };
    return new tarvod::Monitor(hooks);
  }();
  const std::span<const uint8_t> record(data, size);
  tarvod::ConvertAuditRecord(record, *monitor);
  tarvod::bsm::RecordLengthFromHeader(record);
  for (std::span<const uint8_t> rest = record; !rest.empty();) {
    const std::optional<tarvod::bsm::Token> token = tarvod::bsm::FetchToken(rest);
    if (!token) break;
    if (token->length == 0 || token->length > rest.size()) __builtin_trap();
    rest = rest.subspan(token->length);
  }
  return 0;
}
