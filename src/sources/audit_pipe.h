// The audit source: the BSM audit pipe, read on the input queue, and the conversion of a
// secure-shell login record into an "auth.success" or "auth.failure" event. OpenAuditPipe
// runs on the main thread; the read source and its records on the input queue; the
// conversion functions are pure and may be called from any thread.
#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "plist/value.h"

namespace tarvod {

class EventLoop;
class IoSource;
class Monitor;

inline constexpr const char* kAuditPipePath = "/dev/auditpipe";
// The event type of a secure-shell login in the 32-bit header.
inline constexpr uint16_t kSshLoginEvent = 32800;
// Records are never read into a buffer larger than this, whatever the pipe reports.
inline constexpr uint64_t kMaxAuditRecordBytes = 1024 * 1024;

// Opens and configures the pipe (local preselection of login/logout records, flushed). 0 and
// the descriptor and maximum record size, or an error number after logging the failed step.
int OpenAuditPipe(int* descriptor, uint64_t* bufferSize);

// The running read source; destroying it (input queue thread only) cancels it and closes the
// descriptor.
class AuditReadSource {
 public:
  ~AuditReadSource();
  AuditReadSource(const AuditReadSource&) = delete;
  AuditReadSource& operator=(const AuditReadSource&) = delete;

 private:
  friend int StartAuditPipeSource(int, uint64_t, Monitor&, EventLoop&,
                                  std::unique_ptr<AuditReadSource>*);
  AuditReadSource() = default;
  int mFd = -1;
  std::unique_ptr<IoSource> mSource;
};

// Starts reading the pipe on the queue (call on the queue's thread): each read is one record,
// handed to ConvertAuditRecord. 0, an error number, or -1 when no source can be created.
int StartAuditPipeSource(int descriptor, uint64_t bufferSize, Monitor& monitor, EventLoop& queue,
                         std::unique_ptr<AuditReadSource>* source);

// The event for one record, or nullopt when it is dropped (a token that cannot be decoded,
// or a 32-bit header of another event type).
std::optional<plist::Dictionary> AuditRecordToEvent(std::span<const uint8_t> record);
// Converts one record and hands its event, if any, to the monitor's processEvent.
void ConvertAuditRecord(std::span<const uint8_t> record, Monitor& monitor);

// The terminal address as text: IPv6 for type 16, dotted IPv4 for type 4, else "invalid".
std::string FormatTerminalAddress(uint32_t type, const std::array<uint8_t, 16>& address);

// Reads one whole record from a blocking stream of records (header first). 0, or an error
// number; ENODATA at the end of the stream, EBADMSG when no header starts the record.
int ReadAuditRecord(int fd, std::vector<uint8_t>* record);

}  // namespace tarvod
