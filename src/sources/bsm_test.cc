#include "sources/bsm.h"

#include <gtest/gtest.h>

#include <random>
#include <vector>

namespace tarvod::bsm {
namespace {

using Bytes = std::vector<uint8_t>;

void Put(Bytes& b, uint64_t value, int width) {
  for (int i = width - 1; i >= 0; --i) b.push_back(static_cast<uint8_t>(value >> (8 * i)));
}
Bytes Zeros(size_t n) { return Bytes(n, 0); }
Bytes Cat(std::initializer_list<Bytes> parts) {
  Bytes all;
  for (const Bytes& p : parts) all.insert(all.end(), p.begin(), p.end());
  return all;
}
Bytes Token(uint8_t id, Bytes body) {
  body.insert(body.begin(), id);
  return body;
}
Bytes Counted(int width, size_t n, uint8_t fill = 'x') {
  Bytes b;
  Put(b, n, width);
  b.insert(b.end(), n, fill);
  return b;
}
Bytes U(uint64_t v, int width) {
  Bytes b;
  Put(b, v, width);
  return b;
}

// One token of every type the decoder knows, laid out by the published format.
std::vector<Bytes> EveryTokenType() {
  return {
      Token(0x11, Cat({Zeros(8), Counted(2, 5)})),                     // other file
      Token(0x13, Cat({U(0xb105, 2), U(100, 4)})),                     // trailer
      Token(0x14, Cat({U(18, 4), U(11, 1), U(32800, 2), Zeros(10)})),  // header32
      Token(0x15, Cat({Zeros(9), U(16, 4), Zeros(16), Zeros(8)})),     // header32 ex
      Token(0x21, Cat({U(0, 1), U(2, 1), U(3, 1), Zeros(12)})),        // data: 3 int32
      Token(0x22, Zeros(5)),                                           // ipc
      Token(0x23, Counted(2, 7)),                                      // path
      Token(0x24, Zeros(36)),                                          // subject32
      Token(0x25, Counted(2, 3)),                                      // xattr path
      Token(0x26, Zeros(36)),                                          // process32
      Token(0x27, Zeros(5)),                                           // return32
      Token(0x28, Counted(2, 4)),                                      // text
      Token(0x29, Counted(2, 9)),                                      // opaque
      Token(0x2a, Zeros(4)),                                           // in_addr
      Token(0x2b, Zeros(20)),                                          // ip
      Token(0x2c, Zeros(2)),                                           // iport
      Token(0x2d, Cat({Zeros(5), Counted(2, 3)})),                     // arg32
      Token(0x2e, Zeros(14)),                                          // socket
      Token(0x2f, Zeros(4)),                                           // seq
      Token(0x31, Zeros(28)),                                          // attr
      Token(0x32, Zeros(28)),                                          // ipc perm
      Token(0x34, Cat({U(2, 2), Zeros(8)})),                           // groups
      Token(0x38, Cat({Counted(2, 3), Counted(2, 4)})),                // priv
      Token(0x39, Cat({Zeros(1), Counted(2, 6)})),                     // upriv
      Token(0x3b, Cat({U(3, 2), Zeros(12)})),                          // new groups
      Token(0x3c, Cat({U(2, 4), Bytes{'l', 's', 0, '-', 'l', 0}})),    // exec args
      Token(0x3d, Cat({U(1, 4), Bytes{'A', '=', '1', 0}})),            // exec env
      Token(0x3e, Zeros(28)),                                          // attr32
      Token(0x52, Zeros(8)),                                           // exit
      Token(0x60, Counted(2, 6)),                                      // zone name
      Token(0x71, Cat({Zeros(9), Counted(2, 2)})),                     // arg64
      Token(0x72, Zeros(9)),                                           // return64
      Token(0x73, Zeros(32)),                                          // attr64
      Token(0x74, Zeros(25)),                                          // header64
      Token(0x75, Zeros(40)),                                          // subject64
      Token(0x77, Zeros(40)),                                          // process64
      Token(0x79, Cat({Zeros(9), U(4, 4), Zeros(4), Zeros(16)})),      // header64 ex
      Token(0x7a, Cat({Zeros(32), U(4, 4), Zeros(4)})),                // subject32 ex
      Token(0x7b, Cat({Zeros(32), U(16, 4), Zeros(16)})),              // process32 ex
      Token(0x7c, Cat({Zeros(36), U(4, 4), Zeros(4)})),                // subject64 ex
      Token(0x7d, Cat({Zeros(36), U(16, 4), Zeros(16)})),              // process64 ex
      Token(0x7e, Cat({U(16, 4), Zeros(16)})),                         // in_addr ex
      Token(0x7f, Cat({Zeros(4), U(4, 2), Zeros(2), Zeros(4), Zeros(2), Zeros(4)})),  // socket ex
      Token(0x80, Zeros(8)),                                                          // sockinet32
      Token(0x81, Zeros(20)),                                                         // sockinet128
      Token(0x82, Cat({Zeros(2), Bytes{'/', 't', 'm', 'p', 0}})),                     // sockunix
  };
}

TEST(BsmToken, EveryTokenTypeDecodesToExactlyItsOwnLength) {
  for (const Bytes& token : EveryTokenType()) {
    SCOPED_TRACE(::testing::Message() << "token 0x" << std::hex << int{token[0]});
    // Trailing bytes of a following token must not be counted in.
    Bytes followed = Cat({token, Bytes{0x13, 0xb1, 0x05, 0, 0, 0, 0}});
    const auto decoded = FetchToken(followed);
    ASSERT_TRUE(decoded.has_value());
    EXPECT_EQ(decoded->length, token.size());
    EXPECT_EQ(decoded->id, token[0]);
  }
}

TEST(BsmToken, EveryTokenTypeCutShortFailsToDecode) {
  for (const Bytes& token : EveryTokenType()) {
    SCOPED_TRACE(::testing::Message() << "token 0x" << std::hex << int{token[0]});
    for (size_t cut = 0; cut < token.size(); ++cut) {
      EXPECT_FALSE(FetchToken(std::span(token.data(), cut)).has_value()) << "cut at " << cut;
    }
  }
}

TEST(BsmToken, ARecordOfEveryTokenTypeIsWalkedToItsEnd) {
  Bytes record;
  for (const Bytes& token : EveryTokenType()) record = Cat({record, token});
  size_t offset = 0;
  size_t tokens = 0;
  while (offset < record.size()) {
    const auto token = FetchToken(std::span(record).subspan(offset));
    ASSERT_TRUE(token.has_value()) << "at offset " << offset;
    offset += token->length;
    ++tokens;
  }
  EXPECT_EQ(offset, record.size());
  EXPECT_EQ(tokens, EveryTokenType().size());
}

TEST(BsmToken, DecodesTheFieldsOfTheFourTokensUsed) {
  const auto header = FetchToken(Token(0x14, Cat({U(18, 4), U(11, 1), U(32800, 2), Zeros(10)})));
  ASSERT_TRUE(header);
  EXPECT_EQ(header->eventType, 32800);

  const auto subject = FetchToken(Token(0x7a, Cat({Zeros(32), U(4, 4), Bytes{192, 0, 2, 7}})));
  ASSERT_TRUE(subject);
  EXPECT_EQ(subject->length, 41u);
  EXPECT_EQ(subject->addressType, 4u);
  EXPECT_EQ(subject->address[0], 192);
  EXPECT_EQ(subject->address[3], 7);

  // Any other address type is reported with a full-width address.
  const auto unknown = FetchToken(Token(0x7a, Cat({Zeros(32), U(0, 4), Zeros(16)})));
  ASSERT_TRUE(unknown);
  EXPECT_EQ(unknown->length, 53u);
  EXPECT_EQ(unknown->addressType, 0u);

  const Bytes textToken = Token(0x28, Cat({U(6, 2), Bytes{'h', 'e', 'l', 'l', 'o', 0}}));
  const auto text = FetchToken(textToken);  // the text points into textToken
  ASSERT_TRUE(text);
  EXPECT_EQ(text->text, "hello");

  const auto ret = FetchToken(Token(0x27, Cat({U(1, 1), U(255, 4)})));
  ASSERT_TRUE(ret);
  EXPECT_EQ(ret->returnStatus, 1);
  EXPECT_EQ(ret->returnValue, 255u);
}

TEST(BsmToken, RejectsUnknownIdentifiersAndImpossibleSizes) {
  EXPECT_FALSE(FetchToken(Bytes{0x00, 1, 2, 3}));
  EXPECT_FALSE(FetchToken(Bytes{0xff}));
  EXPECT_FALSE(FetchToken(Bytes{}));
  // An extended address whose type is neither 4 nor 16.
  EXPECT_FALSE(FetchToken(Token(0x7e, Cat({U(5, 4), Zeros(16)}))));
  // A data token with an unknown unit.
  EXPECT_FALSE(FetchToken(Token(0x21, Cat({U(0, 1), U(9, 1), U(1, 1), Zeros(8)}))));
  // A unix socket path without its terminator.
  EXPECT_FALSE(FetchToken(Token(0x82, Cat({Zeros(2), Bytes(200, 'a')}))));
}

TEST(BsmToken, RecordLengthIsReadFromAnyHeaderKind) {
  EXPECT_EQ(RecordLengthFromHeader(Bytes{0x14, 0, 0, 1, 2}), 258u);
  EXPECT_EQ(RecordLengthFromHeader(Bytes{0x79, 0, 0, 0, 30, 9}), 30u);
  EXPECT_FALSE(RecordLengthFromHeader(Bytes{0x28, 0, 0, 0, 30}));
  EXPECT_FALSE(RecordLengthFromHeader(Bytes{0x14, 0, 0}));
}

TEST(BsmToken, RandomAndMutatedBytesNeverReadOutOfBounds) {
  std::mt19937 random(12345);
  Bytes record;
  for (const Bytes& token : EveryTokenType()) record = Cat({record, token});
  for (int round = 0; round < 20000; ++round) {
    Bytes bytes;
    if (round % 2 == 0) {
      bytes.resize(random() % 64);
      for (auto& b : bytes) b = static_cast<uint8_t>(random());
      if (!bytes.empty()) bytes[0] = static_cast<uint8_t>(0x10 + random() % 0x74);
    } else {
      bytes = record;
      for (int flips = 0; flips < 4; ++flips) bytes[random() % bytes.size()] = random();
      bytes.resize(random() % (bytes.size() + 1));
    }
    // Decoded on a heap copy of exactly its size, so that the sanitizers see any overrun.
    auto copy = std::make_unique<uint8_t[]>(bytes.size() + 1);
    std::copy(bytes.begin(), bytes.end(), copy.get());
    std::span<const uint8_t> span(copy.get(), bytes.size());
    size_t offset = 0;
    while (offset < span.size()) {
      const auto token = FetchToken(span.subspan(offset));
      if (!token) break;
      ASSERT_GT(token->length, 0u);
      ASSERT_LE(token->length, span.size() - offset);
      offset += token->length;
    }
  }
}

}  // namespace
}  // namespace tarvod::bsm
