#include "sources/bsm.h"

#include <gtest/gtest.h>

#include <vector>

#include "sources/testing/bsm_bytes.h"

namespace tarvod::bsm {
namespace {

using namespace ::tarvod::testing;

// In a record of every type, the bytes of the token after one are never counted in.
TEST(BsmToken, EveryTokenTypeDecodesToExactlyItsOwnLength) {
  Bytes record;
  for (const auto& [name, token] : EveryTokenType()) record = Cat({record, token});
  record = Cat({record, Bytes{0x13, 0xb1, 0x05, 0, 0, 0, 0}});
  size_t offset = 0;
  for (const auto& [name, token] : EveryTokenType()) {
    SCOPED_TRACE(name);
    const auto decoded = FetchToken(std::span(record).subspan(offset));
    ASSERT_TRUE(decoded.has_value());
    EXPECT_EQ(decoded->length, token.size());
    EXPECT_EQ(decoded->id, token[0]);
    offset += token.size();
  }
}

TEST(BsmToken, EveryTokenTypeCutShortFailsToDecode) {
  for (const auto& [name, token] : EveryTokenType()) {
    SCOPED_TRACE(name);
    for (size_t cut = 0; cut < token.size(); ++cut) {
      EXPECT_FALSE(FetchToken(std::span(token.data(), cut)).has_value()) << "cut at " << cut;
    }
  }
}

TEST(BsmToken, DecodesTheFieldsOfTheFourTokensUsed) {
  const auto header =
      FetchToken(MakeToken(0x14, Cat({U(18, 4), U(11, 1), U(32800, 2), Zeros(10)})));
  ASSERT_TRUE(header);
  EXPECT_EQ(header->eventType, 32800);

  const auto subject = FetchToken(MakeToken(0x7a, Cat({Zeros(32), U(4, 4), Bytes{192, 0, 2, 7}})));
  ASSERT_TRUE(subject);
  EXPECT_EQ(subject->length, 41u);
  EXPECT_EQ(subject->addressType, 4u);
  EXPECT_EQ(subject->address[0], 192);
  EXPECT_EQ(subject->address[3], 7);

  // Any other address type is reported with a full-width address.
  const auto unknown = FetchToken(MakeToken(0x7a, Cat({Zeros(32), U(0, 4), Zeros(16)})));
  ASSERT_TRUE(unknown);
  EXPECT_EQ(unknown->length, 53u);
  EXPECT_EQ(unknown->addressType, 0u);

  const Bytes textToken = MakeToken(0x28, Cat({U(6, 2), Bytes{'h', 'e', 'l', 'l', 'o', 0}}));
  const auto text = FetchToken(textToken);  // the text points into textToken
  ASSERT_TRUE(text);
  EXPECT_EQ(text->text, "hello");

  const auto ret = FetchToken(MakeToken(0x27, Cat({U(1, 1), U(255, 4)})));
  ASSERT_TRUE(ret);
  EXPECT_EQ(ret->returnStatus, 1);
  EXPECT_EQ(ret->returnValue, 255u);
}

TEST(BsmToken, RejectsUnknownIdentifiersAndImpossibleSizes) {
  EXPECT_FALSE(FetchToken(Bytes{0x00, 1, 2, 3}));
  EXPECT_FALSE(FetchToken(Bytes{0xff}));
  // The X object and X protocol tokens have no published layout.
  EXPECT_FALSE(FetchToken(MakeToken(0x41, Zeros(16))));
  EXPECT_FALSE(FetchToken(MakeToken(0x42, Zeros(16))));
  // A command token whose argument runs past the end.
  EXPECT_FALSE(FetchToken(MakeToken(0x51, Cat({U(1, 2), U(9, 2), Zeros(3)}))));
  EXPECT_FALSE(FetchToken(Bytes{}));
  // An extended address whose type is neither 4 nor 16.
  EXPECT_FALSE(FetchToken(MakeToken(0x7e, Cat({U(5, 4), Zeros(16)}))));
  // A data token with an unknown unit.
  EXPECT_FALSE(FetchToken(MakeToken(0x21, Cat({U(0, 1), U(9, 1), U(1, 1), Zeros(8)}))));
  // A unix socket path without its terminator.
  EXPECT_FALSE(FetchToken(MakeToken(0x82, Cat({Zeros(2), Bytes(200, 'a')}))));
}

TEST(BsmToken, RecordLengthIsReadFromAnyHeaderKind) {
  EXPECT_EQ(RecordLengthFromHeader(Bytes{0x14, 0, 0, 1, 2}), 258u);
  EXPECT_EQ(RecordLengthFromHeader(Bytes{0x79, 0, 0, 0, 30, 9}), 30u);
  EXPECT_FALSE(RecordLengthFromHeader(Bytes{0x28, 0, 0, 0, 30}));
  EXPECT_FALSE(RecordLengthFromHeader(Bytes{0x14, 0, 0}));
}

// Random and mutated bytes are walked in audit_pipe_test.cc.
}  // namespace
}  // namespace tarvod::bsm
