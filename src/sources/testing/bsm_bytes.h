// Test support: BSM tokens and audit records built byte by byte, laid out by the published
// format (fields big-endian). Test-only.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <string_view>
#include <vector>

namespace tarvod::testing {

using Bytes = std::vector<uint8_t>;

// value as width big-endian bytes.
inline Bytes U(uint64_t value, int width) {
  Bytes b;
  for (int i = width - 1; i >= 0; --i) b.push_back(static_cast<uint8_t>(value >> (8 * i)));
  return b;
}
inline Bytes Zeros(size_t n) { return Bytes(n, 0); }
inline Bytes Cat(std::initializer_list<Bytes> parts) {
  Bytes all;
  for (const Bytes& p : parts) all.insert(all.end(), p.begin(), p.end());
  return all;
}
inline Bytes MakeToken(uint8_t id, Bytes body) {
  body.insert(body.begin(), id);
  return body;
}
// A length of width bytes and that many bytes of fill.
inline Bytes Counted(int width, size_t n, uint8_t fill = 'x') {
  Bytes b = U(n, width);
  b.insert(b.end(), n, fill);
  return b;
}

// One token of every type of the format, each with its name.
struct NamedToken {
  const char* name;
  Bytes bytes;
};
inline std::vector<NamedToken> EveryTokenType() {
  const Bytes string = Counted(2, 4);  // a counted string, as cmd and the X tokens hold them
  return {
      {"other file32", MakeToken(0x11, Cat({Zeros(8), Counted(2, 5)}))},
      {"trailer", MakeToken(0x13, Cat({U(0xb105, 2), U(100, 4)}))},
      {"header32", MakeToken(0x14, Cat({U(18, 4), U(11, 1), U(32800, 2), Zeros(10)}))},
      {"header32 ex", MakeToken(0x15, Cat({Zeros(9), U(16, 4), Zeros(16), Zeros(8)}))},
      {"data: 3 int32", MakeToken(0x21, Cat({U(0, 1), U(2, 1), U(3, 1), Zeros(12)}))},
      {"ipc", MakeToken(0x22, Zeros(5))},
      {"path", MakeToken(0x23, Counted(2, 7))},
      {"subject32", MakeToken(0x24, Zeros(36))},
      {"xattr path", MakeToken(0x25, Counted(2, 3))},
      {"process32", MakeToken(0x26, Zeros(36))},
      {"return32", MakeToken(0x27, Zeros(5))},
      {"text", MakeToken(0x28, Counted(2, 4))},
      {"opaque", MakeToken(0x29, Counted(2, 9))},
      {"in_addr", MakeToken(0x2a, Zeros(4))},
      {"ip", MakeToken(0x2b, Zeros(20))},
      {"iport", MakeToken(0x2c, Zeros(2))},
      {"arg32", MakeToken(0x2d, Cat({Zeros(5), Counted(2, 3)}))},
      {"socket", MakeToken(0x2e, Zeros(14))},
      {"seq", MakeToken(0x2f, Zeros(4))},
      {"acl", MakeToken(0x30, Zeros(12))},
      {"attr", MakeToken(0x31, Zeros(28))},
      {"ipc perm", MakeToken(0x32, Zeros(28))},
      {"label", MakeToken(0x33, Zeros(36))},
      {"groups", MakeToken(0x34, Cat({U(2, 2), Zeros(8)}))},
      {"ace", MakeToken(0x35, Zeros(12))},
      {"priv", MakeToken(0x38, Cat({Counted(2, 3), Counted(2, 4)}))},
      {"upriv", MakeToken(0x39, Cat({Zeros(1), Counted(2, 6)}))},
      {"liaison", MakeToken(0x3a, Zeros(4))},
      {"new groups", MakeToken(0x3b, Cat({U(3, 2), Zeros(12)}))},
      {"exec args", MakeToken(0x3c, Cat({U(2, 4), Bytes{'l', 's', 0, '-', 'l', 0}}))},
      {"exec env", MakeToken(0x3d, Cat({U(1, 4), Bytes{'A', '=', '1', 0}}))},
      {"attr32", MakeToken(0x3e, Zeros(28))},
      {"use of authorization", MakeToken(0x3f, Counted(2, 8))},
      {"xatom", MakeToken(0x40, string)},
      {"xselect", MakeToken(0x43, Cat({string, Counted(2, 2), Counted(2, 6)}))},
      {"xcolormap", MakeToken(0x44, Zeros(8))},
      {"xcursor", MakeToken(0x45, Zeros(8))},
      {"xfont", MakeToken(0x46, Zeros(8))},
      {"xgc", MakeToken(0x47, Zeros(8))},
      {"xpixmap", MakeToken(0x48, Zeros(8))},
      {"xproperty", MakeToken(0x49, Cat({Zeros(8), string}))},
      {"xwindow", MakeToken(0x4a, Zeros(8))},
      {"xclient", MakeToken(0x4b, Zeros(4))},
      {"cmd: 2 args, 1 variable",
       MakeToken(0x51, Cat({U(2, 2), string, Counted(2, 1), U(1, 2), string}))},
      {"exit", MakeToken(0x52, Zeros(8))},
      {"zone name", MakeToken(0x60, Counted(2, 6))},
      {"host", MakeToken(0x70, Zeros(4))},
      {"arg64", MakeToken(0x71, Cat({Zeros(9), Counted(2, 2)}))},
      {"return64", MakeToken(0x72, Zeros(9))},
      {"attr64", MakeToken(0x73, Zeros(32))},
      {"header64", MakeToken(0x74, Zeros(25))},
      {"subject64", MakeToken(0x75, Zeros(40))},
      {"process64", MakeToken(0x77, Zeros(40))},
      {"other file64", MakeToken(0x78, Cat({Zeros(16), Counted(2, 5)}))},
      {"header64 ex", MakeToken(0x79, Cat({Zeros(9), U(4, 4), Zeros(4), Zeros(16)}))},
      {"subject32 ex", MakeToken(0x7a, Cat({Zeros(32), U(4, 4), Zeros(4)}))},
      {"process32 ex", MakeToken(0x7b, Cat({Zeros(32), U(16, 4), Zeros(16)}))},
      {"subject64 ex", MakeToken(0x7c, Cat({Zeros(36), U(4, 4), Zeros(4)}))},
      {"process64 ex", MakeToken(0x7d, Cat({Zeros(36), U(16, 4), Zeros(16)}))},
      {"in_addr ex", MakeToken(0x7e, Cat({U(16, 4), Zeros(16)}))},
      {"socket ex",
       MakeToken(0x7f, Cat({Zeros(4), U(4, 2), Zeros(2), Zeros(4), Zeros(2), Zeros(4)}))},
      {"sockinet32", MakeToken(0x80, Zeros(8))},
      {"sockinet128", MakeToken(0x81, Zeros(20))},
      {"sockunix", MakeToken(0x82, Cat({Zeros(2), Bytes{'/', 't', 'm', 'p', 0}}))},
      {"capability rights", MakeToken(0x83, Zeros(16))},
      {"identity", MakeToken(0xed, Cat({Zeros(4), Counted(2, 5), Zeros(1), Counted(2, 3), Zeros(1),
                                        Counted(2, 20)}))},
  };
}

// An audit record, token by token.
struct RecordBuilder {
  Bytes bytes;
  RecordBuilder& raw(const Bytes& b) {
    bytes.insert(bytes.end(), b.begin(), b.end());
    return *this;
  }
  RecordBuilder& header32(uint16_t event) {
    return raw(MakeToken(0x14, Cat({U(0, 4), U(11, 1), U(event, 2), Zeros(2 + 4 + 4)})));
  }
  // An extended 32-bit subject: audit, effective and real IDs, pid, session and port, then the
  // terminal address of the given type.
  RecordBuilder& subject(uint32_t type, const Bytes& address) {
    Bytes ids;
    for (int i = 0; i < 8; ++i) ids = Cat({ids, U(1000 + i, 4)});
    return raw(MakeToken(0x7a, Cat({ids, U(type, 4), address})));
  }
  RecordBuilder& text(std::string_view s) {
    return raw(MakeToken(0x28, Cat({U(s.size() + 1, 2), Bytes(s.begin(), s.end()), Zeros(1)})));
  }
  RecordBuilder& ret(uint8_t status, uint32_t value) {
    return raw(MakeToken(0x27, Cat({U(status, 1), U(value, 4)})));
  }
  RecordBuilder& trailer() {
    return raw(MakeToken(0x13, Cat({U(0xb105, 2), U(bytes.size() + 7, 4)})));
  }
};

}  // namespace tarvod::testing
