#include "sources/audit_pipe.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <new>

#include "platform/diagnostic_log.h"
#include "platform/event_loop.h"
#include "sources/bsm.h"
#include "sources/monitor.h"

namespace tarvod {
namespace {

// Requests of the BSM audit pipe interface.
struct AuditMask {
  uint32_t success;
  uint32_t failure;
};
constexpr unsigned long kSetPreselectFlags = _IOW('A', 7, AuditMask);
constexpr unsigned long kSetPreselectNaFlags = _IOW('A', 9, AuditMask);
constexpr unsigned long kSetPreselectMode = _IOW('A', 15, int);
constexpr unsigned long kFlush = _IO('A', 16);
constexpr unsigned long kGetMaxAuditData = _IOR('A', 17, unsigned int);

constexpr int kPreselectModeLocal = 2;
constexpr uint32_t kLoginLogoutClass = 0x1000;

bool IsValidUtf8(std::string_view text) {
  size_t i = 0;
  while (i < text.size()) {
    const auto lead = static_cast<unsigned char>(text[i]);
    size_t extra;
    uint32_t codePoint;
    if (lead < 0x80) {
      ++i;
      continue;
    } else if ((lead & 0xE0) == 0xC0) {
      extra = 1;
      codePoint = lead & 0x1F;
    } else if ((lead & 0xF0) == 0xE0) {
      extra = 2;
      codePoint = lead & 0x0F;
    } else if ((lead & 0xF8) == 0xF0) {
      extra = 3;
      codePoint = lead & 0x07;
    } else {
      return false;
    }
    if (i + extra >= text.size()) return false;
    for (size_t k = 1; k <= extra; ++k) {
      const auto next = static_cast<unsigned char>(text[i + k]);
      if ((next & 0xC0) != 0x80) return false;
      codePoint = (codePoint << 6) | (next & 0x3F);
    }
    static constexpr uint32_t kSmallest[] = {0, 0x80, 0x800, 0x10000};
    if (codePoint < kSmallest[extra] || codePoint > 0x10FFFF ||
        (codePoint >= 0xD800 && codePoint <= 0xDFFF)) {
      return false;
    }
    i += extra + 1;
  }
  return true;
}

bool ReadFully(int fd, uint8_t* into, size_t length, int* error) {
  while (length > 0) {
    const ssize_t got = read(fd, into, length);
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) {
      *error = got == 0 ? ENODATA : errno;
      return false;
    }
    into += got;
    length -= static_cast<size_t>(got);
  }
  return true;
}

}  // namespace

int OpenAuditPipe(int* descriptor, uint64_t* bufferSize) {
  const int fd = open(kAuditPipePath, O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    const int error = errno;
    std::perror("failed to open the auditpipe");
    LogMessage(4, "open of %s failed errno = %d", kAuditPipePath, error);
    return error;
  }
  int mode = kPreselectModeLocal;
  if (ioctl(fd, kSetPreselectMode, &mode) < 0) {
    const int error = errno;
    LogMessage(4, "AUDITPIPE_SET_PRESELECT_MODE failed");
    close(fd);
    return error;
  }
  AuditMask mask{kLoginLogoutClass, kLoginLogoutClass};
  if (ioctl(fd, kSetPreselectFlags, &mask) < 0) {
    const int error = errno;
    LogMessage(4, "AUDITPIPE_SET_PRESELECT_FLAGS failed");
    close(fd);
    return error;
  }
  if (ioctl(fd, kSetPreselectNaFlags, &mask) < 0) {
    const int error = errno;
    LogMessage(4, "AUDITPIPE_SET_PRESELECT_NAFLAGS failed");
    close(fd);
    return error;
  }
  unsigned int maximum = 0;
  if (ioctl(fd, kGetMaxAuditData, &maximum) < 0) {
    const int error = errno;
    close(fd);
    LogMessage(4, "AUDITPIPE_GET_MAXAUDITDATA failed errno = %d", error);
    return error;
  }
  *bufferSize = maximum;
  LogMessage(3, "Flushing the Auditpipe");
  if (ioctl(fd, kFlush) < 0) LogMessage(4, "flush failed errno = %d", errno);
  *descriptor = fd;
  return 0;
}

AuditReadSource::~AuditReadSource() {
  mSource.reset();
  if (mFd >= 0) close(mFd);
}

int StartAuditPipeSource(int descriptor, uint64_t bufferSize, Monitor& monitor, EventLoop& queue,
                         std::unique_ptr<AuditReadSource>* source) {
  unsigned int maximum = 0;
  if (ioctl(descriptor, kGetMaxAuditData, &maximum) < 0) return errno;
  const int flags = fcntl(descriptor, F_GETFL);
  if (flags < 0 || fcntl(descriptor, F_SETFL, flags | O_NONBLOCK) < 0) return errno;

  std::unique_ptr<AuditReadSource> created(new AuditReadSource());
  const uint64_t size = std::min(bufferSize, kMaxAuditRecordBytes);
  created->mSource =
      queue.addIo(descriptor, EPOLLIN, /*gated=*/true, [descriptor, size, &monitor](uint32_t) {
        std::vector<uint8_t> buffer;
        try {
          buffer.resize(size);
        } catch (const std::bad_alloc&) {
          return;  // no buffer this time; the source fires again
        }
        const ssize_t got = read(descriptor, buffer.data(), buffer.size());
        // An empty read carries no record: nothing to convert.
        if (got <= 0) return;
        ConvertAuditRecord(std::span<const uint8_t>(buffer.data(), static_cast<size_t>(got)),
                           monitor);
        monitor.applyBackPressure();
      });
  if (!created->mSource) return -1;
  created->mFd = descriptor;  // from here on the source's cancellation closes it
  *source = std::move(created);
  return 0;
}

std::string FormatTerminalAddress(uint32_t type, const std::array<uint8_t, 16>& address) {
  char text[INET6_ADDRSTRLEN] = "invalid";  // 46 bytes: the longest IPv6 text and its NUL
  if (type == bsm::kAddressIPv6) {
    if (inet_ntop(AF_INET6, address.data(), text, sizeof text) == nullptr) return "invalid";
  } else if (type == bsm::kAddressIPv4) {
    if (inet_ntop(AF_INET, address.data(), text, sizeof text) == nullptr) return "invalid";
  }
  return text;
}

std::optional<plist::Dictionary> AuditRecordToEvent(std::span<const uint8_t> record) {
  bool success = false;
  std::optional<std::string> clientIP;
  std::optional<std::string> message;
  size_t offset = 0;
  while (offset != record.size()) {
    const std::optional<bsm::Token> token = bsm::FetchToken(record.subspan(offset));
    if (!token) return std::nullopt;
    offset += token->length;
    switch (token->id) {
      case bsm::kHeader32:
        if (token->eventType != kSshLoginEvent) return std::nullopt;
        break;
      case bsm::kSubject32Ex:
        clientIP = FormatTerminalAddress(token->addressType, token->address);
        break;
      case bsm::kText:
        if (IsValidUtf8(token->text)) {
          message = std::string(token->text);
        } else {
          message.reset();
        }
        break;
      case bsm::kReturn32:
        if (token->returnValue == 0) success = true;
        break;
      default:
        break;
    }
  }
  plist::Dictionary details;
  if (clientIP) details.set("clientIP", *clientIP);
  if (message) details.set("message", *message);
  details.set("protocolName", "SSH");
  details.set("username", "untrusted");
  plist::Dictionary event;
  event.set("eventType", success ? "auth.success" : "auth.failure");
  event.set("eventDetails", std::move(details));
  event.set("eventSource", "Auditpipe");
  return event;
}

void ConvertAuditRecord(std::span<const uint8_t> record, Monitor& monitor) {
  if (std::optional<plist::Dictionary> event = AuditRecordToEvent(record)) {
    monitor.processEvent(std::move(*event), Monitor::EventSource::kSshLogins);
  }
}

int ReadAuditRecord(int fd, std::vector<uint8_t>* record) {
  record->assign(5, 0);
  int error = 0;
  if (!ReadFully(fd, record->data(), 5, &error)) return error;
  const std::optional<uint32_t> length = bsm::RecordLengthFromHeader(*record);
  if (!length || *length < 5 || *length > kMaxAuditRecordBytes) return EBADMSG;
  record->resize(*length);
  if (!ReadFully(fd, record->data() + 5, *length - 5, &error)) return error;
  return 0;
}

}  // namespace tarvod
