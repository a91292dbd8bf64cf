// A decoder for the BSM audit record format: it knows the length of every token type whose
// layout is published (the Solaris, Trusted Extensions, OpenBSM, FreeBSD and Apple tokens) so
// that any record can be walked token by token, and decodes the fields of the four tokens the
// audit source uses. Pure functions over bytes; safe to call from any thread.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string_view>

namespace tarvod::bsm {

// Token identifiers of the four decoded tokens.
inline constexpr uint8_t kHeader32 = 0x14;
inline constexpr uint8_t kReturn32 = 0x27;
inline constexpr uint8_t kText = 0x28;
inline constexpr uint8_t kSubject32Ex = 0x7a;

// Terminal address types of the extended tokens.
inline constexpr uint32_t kAddressIPv4 = 4;
inline constexpr uint32_t kAddressIPv6 = 16;

// One token. id and length are set for every token type; the other fields only for the token
// they belong to. text points into the bytes that were decoded.
struct Token {
  uint8_t id = 0;
  size_t length = 0;  // bytes of the whole token, identifier included

  uint16_t eventType = 0;  // 32-bit header

  uint32_t addressType = 0;           // extended 32-bit subject: terminal ID
  std::array<uint8_t, 16> address{};  // in network order; only addressType bytes are set

  std::string_view text;  // text token, up to its first NUL

  uint8_t returnStatus = 0;  // 32-bit return
  uint32_t returnValue = 0;
};

// Decodes the token at the start of bytes. nullopt when the identifier is not a BSM token
// type, when the token runs past the end of bytes, or when a field that gives a size holds a
// value the format does not allow (an address type other than 4 or 16, for instance; the
// extended subject alone accepts any address type and then holds sixteen address bytes).
std::optional<Token> FetchToken(std::span<const uint8_t> bytes);

// The size of the whole record that begins with a header token (32 or 64-bit, plain or
// extended), read from the header's record byte count once at least five bytes are there.
// nullopt when bytes does not start with a header token or is shorter than five bytes.
std::optional<uint32_t> RecordLengthFromHeader(std::span<const uint8_t> bytes);

}  // namespace tarvod::bsm
