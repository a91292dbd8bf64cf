#include "sources/bsm.h"

#include <algorithm>
#include <cstring>
#include <iterator>

namespace tarvod::bsm {
namespace {

// Token identifiers of the BSM format, grouped by layout. Fields are big-endian.
constexpr uint8_t kOtherFile32 = 0x11;  // seconds 4, msec 4, name length 2, name
constexpr uint8_t kTrailer = 0x13;      // magic 2, record byte count 4
constexpr uint8_t kHeader32Ex =
    0x15;                             // header32 with address type 4 and address after the modifier
constexpr uint8_t kData = 0x21;       // print 1, unit 1, count 1, count units
constexpr uint8_t kIpc = 0x22;        // type 1, id 4
constexpr uint8_t kPath = 0x23;       // length 2, path
constexpr uint8_t kSubject32 = 0x24;  // 7 IDs of 4, port 4, address 4
constexpr uint8_t kXatPath = 0x25;    // length 2, path
constexpr uint8_t kProcess32 = 0x26;  // as subject32
constexpr uint8_t kOpaque = 0x29;     // length 2, bytes
constexpr uint8_t kInAddr = 0x2a;     // address 4
constexpr uint8_t kIp = 0x2b;         // IP header 20
constexpr uint8_t kIport = 0x2c;      // port 2
constexpr uint8_t kArg32 = 0x2d;      // number 1, value 4, text length 2, text
constexpr uint8_t kSocket =
    0x2e;                        // type 2, local port 2, local address 4, remote port 2, address 4
constexpr uint8_t kSeq = 0x2f;   // sequence 4
constexpr uint8_t kAcl = 0x30;   // type 4, value 4, mode 4
constexpr uint8_t kAttr = 0x31;  // mode 4, uid 4, gid 4, fsid 4, node 8, device 4
constexpr uint8_t kIpcPerm = 0x32;    // 7 fields of 4
constexpr uint8_t kLabel = 0x33;      // label ID 1, compartment count 1, class 2, 8 words of 4
constexpr uint8_t kGroups = 0x34;     // count 2, count IDs of 4
constexpr uint8_t kAce = 0x35;        // who 4, access mask 4, flags 2, type 2
constexpr uint8_t kPriv = 0x38;       // set name length 2, name, privileges length 2, privileges
constexpr uint8_t kUpriv = 0x39;      // status 1, privilege length 2, privilege
constexpr uint8_t kLiaison = 0x3a;    // liaison 4
constexpr uint8_t kNewGroups = 0x3b;  // count 2, count IDs of 4
constexpr uint8_t kExecArgs = 0x3c;   // count 4, count NUL-terminated strings
constexpr uint8_t kExecEnv = 0x3d;    // as exec args
constexpr uint8_t kAttr32 = 0x3e;     // as attr
constexpr uint8_t kUseOfAuth = 0x3f;  // length 2, authorization name
constexpr uint8_t kXAtom = 0x40;      // length 2, atom name
constexpr uint8_t kXSelect = 0x43;    // three counted strings: property, type, window data
constexpr uint8_t kXColormap = 0x44;  // X object: XID 4, creator UID 4
constexpr uint8_t kXCursor = 0x45;    // X object
constexpr uint8_t kXFont = 0x46;      // X object
constexpr uint8_t kXGc = 0x47;        // X object
constexpr uint8_t kXPixmap = 0x48;    // X object
constexpr uint8_t kXProperty = 0x49;  // XID 4, creator UID 4, length 2, property name
constexpr uint8_t kXWindow = 0x4a;    // X object
constexpr uint8_t kXClient = 0x4b;    // client ID 4
constexpr uint8_t kCmd = 0x51;   // argument count 2, counted arguments, variable count 2, variables
constexpr uint8_t kExit = 0x52;  // status 4, return 4
constexpr uint8_t kZoneName = 0x60;   // length 2, name
constexpr uint8_t kHost = 0x70;       // host address 4
constexpr uint8_t kArg64 = 0x71;      // number 1, value 8, text length 2, text
constexpr uint8_t kReturn64 = 0x72;   // status 1, value 8
constexpr uint8_t kAttr64 = 0x73;     // mode 4, uid 4, gid 4, fsid 4, node 8, device 8
constexpr uint8_t kHeader64 = 0x74;   // count 4, version 1, event 2, modifier 2, seconds 8, msec 8
constexpr uint8_t kSubject64 = 0x75;  // 7 IDs of 4, port 8, address 4
constexpr uint8_t kProcess64 = 0x77;  // as subject64
constexpr uint8_t kOtherFile64 = 0x78;  // seconds 8, msec 8, name length 2, name
constexpr uint8_t kHeader64Ex = 0x79;   // header64 with address type 4 and address
constexpr uint8_t kProcess32Ex = 0x7b;  // as subject32 ex
constexpr uint8_t kSubject64Ex = 0x7c;  // 7 IDs of 4, port 8, address type 4, address
constexpr uint8_t kProcess64Ex = 0x7d;  // as subject64 ex
constexpr uint8_t kInAddrEx = 0x7e;     // address type 4, address
constexpr uint8_t kSocketEx =
    0x7f;  // domain 2, type 2, address type 2, lport 2, laddr, rport 2, raddr
constexpr uint8_t kSockInet32 = 0x80;   // family 2, port 2, address 4
constexpr uint8_t kSockInet128 = 0x81;  // family 2, port 2, address 16
constexpr uint8_t kSockUnix = 0x82;     // family 2, NUL-terminated path of at most 104 bytes
constexpr uint8_t kRights = 0x83;       // capability rights: 2 words of 8
// Signer type 4; signing ID, its truncation flag 1, team ID, its truncation flag 1, code
// directory hash, each of the three counted by a length 2.
constexpr uint8_t kIdentity = 0xed;

constexpr size_t kMaxUnixPath = 104;

// Reads big-endian fields with bounds checks; a read past the end marks the reader failed and
// returns 0, so that a caller tests ok() once after its reads.
class Reader {
 public:
  explicit Reader(std::span<const uint8_t> bytes) : mBytes(bytes) {}

  bool ok() const { return mOk; }
  size_t offset() const { return mOffset; }

  uint64_t read(size_t width) {
    if (!take(width)) return 0;
    uint64_t value = 0;
    for (size_t i = 0; i < width; ++i) value = (value << 8) | mBytes[mOffset - width + i];
    return value;
  }
  // Skips n bytes; returns where they start.
  size_t skip(uint64_t n) {
    const size_t start = mOffset;
    take(n);
    return start;
  }
  // Skips one NUL-terminated string of at most limit bytes before its NUL.
  void skipString(size_t limit) {
    if (!mOk) return;
    const size_t available = mBytes.size() - mOffset;
    const void* nul = std::memchr(mBytes.data() + mOffset, 0, std::min(available, limit + 1));
    if (nul == nullptr) {
      mOk = false;
      return;
    }
    mOffset = static_cast<const uint8_t*>(nul) - mBytes.data() + 1;
  }
  // An address type of the extended tokens (4 or 16) followed by that many address bytes.
  uint32_t readAddress(size_t typeWidth, std::array<uint8_t, 16>* address) {
    const auto type = static_cast<uint32_t>(read(typeWidth));
    if (!mOk) return 0;
    if (type != kAddressIPv4 && type != kAddressIPv6) {
      mOk = false;
      return 0;
    }
    const size_t start = skip(type);
    if (mOk && address != nullptr) std::memcpy(address->data(), mBytes.data() + start, type);
    return type;
  }
  const uint8_t* at(size_t offset) const { return mBytes.data() + offset; }

 private:
  bool take(uint64_t n) {
    if (!mOk || n > mBytes.size() - mOffset) {
      mOk = false;
      return false;
    }
    mOffset += n;
    return true;
  }

  std::span<const uint8_t> mBytes;
  size_t mOffset = 0;
  bool mOk = true;
};

bool IsHeader(uint8_t id) {
  return id == kHeader32 || id == kHeader32Ex || id == kHeader64 || id == kHeader64Ex;
}

}  // namespace

std::optional<Token> FetchToken(std::span<const uint8_t> bytes) {
  Reader reader(bytes);
  Token token;
  token.id = static_cast<uint8_t>(reader.read(1));
  if (!reader.ok()) return std::nullopt;

  switch (token.id) {
    case kHeader32:
      reader.skip(4 + 1);  // record byte count, version
      token.eventType = static_cast<uint16_t>(reader.read(2));
      reader.skip(2 + 4 + 4);  // modifier, seconds, milliseconds
      break;
    case kHeader32Ex:
      reader.skip(4 + 1 + 2 + 2);
      reader.readAddress(4, nullptr);
      reader.skip(4 + 4);
      break;
    case kHeader64:
      reader.skip(4 + 1 + 2 + 2 + 8 + 8);
      break;
    case kHeader64Ex:
      reader.skip(4 + 1 + 2 + 2);
      reader.readAddress(4, nullptr);
      reader.skip(8 + 8);
      break;
    case kTrailer:
      reader.skip(2 + 4);
      break;
    case kOtherFile32:
      reader.skip(4 + 4);
      reader.skip(reader.read(2));
      break;
    case kOtherFile64:
      reader.skip(8 + 8);
      reader.skip(reader.read(2));
      break;
    case kData: {
      reader.skip(1);  // how to print
      const uint64_t unit = reader.read(1);
      const uint64_t count = reader.read(1);
      static constexpr uint64_t kUnitSizes[] = {1, 2, 4, 8};  // byte, short, int32, int64
      if (reader.ok() && unit >= std::size(kUnitSizes)) return std::nullopt;
      if (reader.ok()) reader.skip(count * kUnitSizes[unit]);
      break;
    }
    case kIpc:
      reader.skip(1 + 4);
      break;
    case kPath:
    case kXatPath:
    case kOpaque:
    case kZoneName:
    case kUseOfAuth:
    case kXAtom:
      reader.skip(reader.read(2));
      break;
    case kXSelect:
      for (int i = 0; i < 3; ++i) reader.skip(reader.read(2));
      break;
    case kXProperty:
      reader.skip(4 + 4);
      reader.skip(reader.read(2));
      break;
    case kCmd:
      // Each of the two lists is a count and that many counted strings; each string takes at
      // least its length field, which bounds the loops by the bytes present.
      for (int list = 0; list < 2; ++list) {
        const uint64_t count = reader.read(2);
        for (uint64_t i = 0; i < count && reader.ok(); ++i) reader.skip(reader.read(2));
      }
      break;
    case kIdentity:
      reader.skip(4);
      reader.skip(reader.read(2));
      reader.skip(1);
      reader.skip(reader.read(2));
      reader.skip(1);
      reader.skip(reader.read(2));
      break;
    case kText: {
      const uint64_t length = reader.read(2);
      const size_t start = reader.skip(length);
      if (reader.ok()) {
        const auto* text = reinterpret_cast<const char*>(reader.at(start));
        token.text = std::string_view(text, strnlen(text, length));
      }
      break;
    }
    case kSubject32:
    case kProcess32:
      reader.skip(7 * 4 + 4 + 4);
      break;
    case kSubject64:
    case kProcess64:
      reader.skip(7 * 4 + 8 + 4);
      break;
    case kSubject32Ex: {
      reader.skip(7 * 4 + 4);  // audit, effective and real IDs, process, session; port
      // The terminal ID is taken whatever its address type, so that the caller can report an
      // unknown type: one of 4 carries four address bytes, any other the full sixteen.
      token.addressType = static_cast<uint32_t>(reader.read(4));
      const size_t width = token.addressType == kAddressIPv4 ? 4 : 16;
      const size_t start = reader.skip(width);
      if (reader.ok()) std::memcpy(token.address.data(), reader.at(start), width);
      break;
    }
    case kProcess32Ex:
      reader.skip(7 * 4 + 4);
      reader.readAddress(4, nullptr);
      break;
    case kSubject64Ex:
    case kProcess64Ex:
      reader.skip(7 * 4 + 8);
      reader.readAddress(4, nullptr);
      break;
    case kReturn32:
      token.returnStatus = static_cast<uint8_t>(reader.read(1));
      token.returnValue = static_cast<uint32_t>(reader.read(4));
      break;
    case kReturn64:
      reader.skip(1 + 8);
      break;
    case kInAddr:
    case kSeq:
    case kLiaison:
    case kHost:
    case kXClient:
      reader.skip(4);
      break;
    case kXColormap:
    case kXCursor:
    case kXFont:
    case kXGc:
    case kXPixmap:
    case kXWindow:
      reader.skip(4 + 4);
      break;
    case kAcl:
    case kAce:
      reader.skip(4 + 4 + 4);
      break;
    case kLabel:
      reader.skip(1 + 1 + 2 + 8 * 4);
      break;
    case kRights:
      reader.skip(2 * 8);
      break;
    case kInAddrEx:
      reader.readAddress(4, nullptr);
      break;
    case kIp:
      reader.skip(20);
      break;
    case kIport:
      reader.skip(2);
      break;
    case kArg32:
      reader.skip(1 + 4);
      reader.skip(reader.read(2));
      break;
    case kArg64:
      reader.skip(1 + 8);
      reader.skip(reader.read(2));
      break;
    case kSocket:
      reader.skip(2 + 2 + 4 + 2 + 4);
      break;
    case kSocketEx: {
      reader.skip(2 + 2);                                    // domain, type
      const uint32_t type = reader.readAddress(2, nullptr);  // local address after its port
      reader.skip(2);
      reader.skip(2 + type);  // remote port and address of the same type
      break;
    }
    case kSockInet32:
      reader.skip(2 + 2 + 4);
      break;
    case kSockInet128:
      reader.skip(2 + 2 + 16);
      break;
    case kSockUnix:
      reader.skip(2);
      reader.skipString(kMaxUnixPath);
      break;
    case kAttr:
    case kAttr32:
      reader.skip(4 + 4 + 4 + 4 + 8 + 4);
      break;
    case kAttr64:
      reader.skip(4 + 4 + 4 + 4 + 8 + 8);
      break;
    case kIpcPerm:
      reader.skip(7 * 4);
      break;
    case kGroups:
    case kNewGroups:
      reader.skip(reader.read(2) * 4);
      break;
    case kExecArgs:
    case kExecEnv: {
      const uint64_t count = reader.read(4);
      // Each string takes at least one byte, which bounds the loop by the bytes present.
      for (uint64_t i = 0; i < count && reader.ok(); ++i) reader.skipString(bytes.size());
      break;
    }
    case kExit:
      reader.skip(4 + 4);
      break;
    case kPriv:
      reader.skip(reader.read(2));
      reader.skip(reader.read(2));
      break;
    case kUpriv:
      reader.skip(1);
      reader.skip(reader.read(2));
      break;
    default:
      return std::nullopt;
  }
  if (!reader.ok()) return std::nullopt;
  token.length = reader.offset();
  return token;
}

std::optional<uint32_t> RecordLengthFromHeader(std::span<const uint8_t> bytes) {
  if (bytes.size() < 5 || !IsHeader(bytes[0])) return std::nullopt;
  return (uint32_t{bytes[1]} << 24) | (uint32_t{bytes[2]} << 16) | (uint32_t{bytes[3]} << 8) |
         uint32_t{bytes[4]};
}

}  // namespace tarvod::bsm
