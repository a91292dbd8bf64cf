#include "plist/codec.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <plist/plist.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cmath>
#include <cstdlib>
#include <limits>
#include <string>
#include <vector>

namespace plist {
namespace {

using namespace std::string_literals;

Value EveryKind() {
  Data bytes;
  for (int i = 0; i < 256; ++i) bytes.push_back(static_cast<uint8_t>(i));
  Dictionary nested{{"inner", Value(Array{Value::Integer(1), Value(Dictionary{})})}};
  Dictionary root;
  // Keys deliberately out of sorted order.
  root.set("zeta", "plain");
  root.set("alpha", "needs \"quotes\", \\ and\nnew lines\ttabs\r\x01\x7f <&> ]]>");
  root.set("Grüße 日本", "non-ASCII: Grüße, 日本語, 😀");
  root.set("", "");
  root.set("numberLike", Value(Array{"123", "-5", "1.5", "true", "nan", "//x", " padded "}));
  root.set("integers", Value(Array{Value::Integer(0), Value::Integer(-7), Value::Integer(42),
                                   Value::Integer(std::numeric_limits<int64_t>::min()),
                                   Value::Integer(std::numeric_limits<int64_t>::max())}));
  root.set("reals", Value(Array{Value::Real(0.1), Value::Real(-2.5), Value::Real(3.0),
                                Value::Real(1e300), Value::Real(5e-324), Value::Real(std::nan("")),
                                Value::Real(std::numeric_limits<double>::infinity()),
                                Value::Real(-std::numeric_limits<double>::infinity())}));
  root.set("booleans", Value(Array{Value::Boolean(true), Value::Boolean(false)}));
  root.set(
      "dates",
      Value(Array{Value::FromDate(Date{0}), Value::FromDate(Date{744076800}),
                  Value::FromDate(Date{-31536000}),
                  // Outside libplist's 32-bit seconds: years 1900 and 2200.
                  Value::FromDate(Date{-3155673600.0}), Value::FromDate(Date{6311433600.0}),
                  // The first and the last second of years 1 to 9999.
                  Value::FromDate(Date{-63113904000.0}), Value::FromDate(Date{252423993599.0})}));
  root.set("data", Value::FromData(bytes));
  root.set("emptyData", Value::FromData({}));
  root.set("emptyArray", Value(Array{}));
  root.set("emptyDictionary", Value(Dictionary{}));
  root.set("nested", Value(std::move(nested)));
  return Value(std::move(root));
}

std::string ToBinary(const std::string& xml) {
  plist_t node = nullptr;
  plist_from_xml(xml.data(), static_cast<uint32_t>(xml.size()), &node);
  EXPECT_NE(node, nullptr);
  char* bytes = nullptr;
  uint32_t length = 0;
  plist_to_bin(node, &bytes, &length);
  std::string result(bytes, length);
  plist_to_bin_free(bytes);
  plist_free(node);
  return result;
}

std::string EveryKindBinary() { return ToBinary(*WriteXmlPropertyList(EveryKind())); }

std::string BigEndian(uint64_t value, size_t size) {
  std::string out(size, '\0');
  for (size_t i = 0; i < size; ++i) out[size - 1 - i] = static_cast<char>(value >> (8 * i));
  return out;
}

// A reference to object `index` in a list built with references of `size` bytes.
std::string Ref(uint64_t index, size_t size = 1) { return BigEndian(index, size); }

// A binary list from raw objects, numbered in order; offsets take one byte while they fit.
std::string BinaryList(const std::vector<std::string>& objects, size_t refSize = 1,
                       uint64_t top = 0) {
  std::string out = "bplist00";
  std::vector<uint64_t> offsets;
  for (const std::string& object : objects) {
    offsets.push_back(out.size());
    out += object;
  }
  const size_t offsetSize = out.size() < 256 ? 1 : 4;
  const uint64_t tableOffset = out.size();
  for (uint64_t offset : offsets) out += BigEndian(offset, offsetSize);
  return out + std::string(6, '\0') + static_cast<char>(offsetSize) + static_cast<char>(refSize) +
         BigEndian(objects.size(), 8) + BigEndian(top, 8) + BigEndian(tableOffset, 8);
}

std::string Repeat(std::string_view s, size_t n) {
  std::string out;
  for (size_t i = 0; i < n; ++i) out += s;
  return out;
}

std::string NestedXml(size_t depth) {
  return "<plist>" + Repeat("<array>", depth) + Repeat("</array>", depth) + "</plist>";
}
std::string NestedText(size_t depth) { return Repeat("(", depth) + Repeat(")", depth); }
// Arrays each holding the next; the last is empty.
std::string NestedBinary(size_t depth) {
  std::vector<std::string> objects;
  for (size_t i = 0; i + 1 < depth; ++i) objects.push_back("\xA1" + Ref(i + 1, 4));
  objects.push_back("\xA0");
  return BinaryList(objects, 4);
}

TEST(PropertyList, RoundTripsEveryKindThroughXmlAndReadsLibplistsBinary) {
  const Value value = EveryKind();
  const std::optional<std::string> xml = WriteXmlPropertyList(value);
  ASSERT_TRUE(xml);
  EXPECT_TRUE(xml->starts_with("<?xml"));
  const std::optional<Value> back = ReadPropertyList(*xml);
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, value) << Describe(*back);
  // Equality compares kinds too; spelled out for the kinds libplist blurs.
  EXPECT_TRUE(back->dictionary().findArray("reals")->at(2).isReal());
  EXPECT_TRUE(back->dictionary().findArray("booleans")->front().isBoolean());
  EXPECT_EQ(back->dictionary().begin()->first, "zeta");
  EXPECT_EQ(ReadPropertyList(EveryKindBinary()), value);
  // XML holds whole seconds: a date is written as the second it falls in.
  const auto before = ReadPropertyList(*WriteXmlPropertyList(Value::FromDate(Date{-10.25})));
  EXPECT_EQ(before->date().secondsSince2001, -11.0);
}

TEST(PropertyListXml, RefusesToWriteWhatCannotBeReadBack) {
  Value deep = Value(Array{});
  for (int i = 0; i < kMaxNestingDepth; ++i) deep = Value(Array{std::move(deep)});
  const Value cases[] = {
      Value(std::string("nul\0inside", 10)),
      Value("\xC3\x28"),
      Value(Dictionary{{"\xFF", Value::Integer(1)}}),
      Value::FromDate(Date{std::nan("")}),
      Value::FromDate(Date{1e18}),
      deep,
  };
  for (const Value& value : cases) EXPECT_FALSE(WriteXmlPropertyList(value)) << Describe(value);
}

TEST(PropertyListBinary, ReadsFractionalDatesWideIntegersAndUids) {
  const std::string date = BinaryList({"\x33\xC0\x24\x80\x00\x00\x00\x00\x00"s});  // -10.25
  EXPECT_EQ(ReadPropertyList(date)->date().secondsSince2001, -10.25);
  const std::string wideNegative = BinaryList({"\x14" + std::string(15, '\xFF') + "\xFB"});
  EXPECT_EQ(ReadPropertyList(wideNegative)->integer(), -5);
  const std::string widePositive = BinaryList({"\x14" + std::string(15, '\0') + "\x05"});
  EXPECT_EQ(ReadPropertyList(widePositive)->integer(), 5);
  // A keyed-archive UID reads as the dictionary XML writes for it.
  EXPECT_EQ(ReadPropertyList(BinaryList({"\x80\x05"})),
            Value(Dictionary{{"CF$UID", Value::Integer(5)}}));
  // Past the 64-bit range: refused rather than wrapped.
  EXPECT_FALSE(
      ReadPropertyList(BinaryList({"\x14" + std::string(8, '\0') + std::string(8, '\xFF')})));
  // Dates outside years 1 to 9999, which no other form holds, are refused: 1e12 and NaN.
  EXPECT_FALSE(ReadPropertyList(BinaryList({"\x33\x42\x6D\x1A\x94\xA2\x00\x00\x00"s})));
  EXPECT_FALSE(ReadPropertyList(BinaryList({"\x33\x7F\xF8\x00\x00\x00\x00\x00\x00"s})));
  EXPECT_EQ(ReadPropertyList(BinaryList({"\x60"s})), Value(""));
}

TEST(PropertyListText, RoundTripsEveryKindThroughDescribe) {
  const Value value = EveryKind();
  const std::optional<Value> back = ParseTextPropertyList(Describe(value));
  ASSERT_TRUE(back) << Describe(value);
  EXPECT_EQ(*back, value) << Describe(*back);
  EXPECT_EQ(ReadPropertyList(Describe(value)), value);
  for (const auto& [key, item] : value.dictionary()) {
    EXPECT_EQ(ParseTextPropertyList(Describe(item)), item) << Describe(item);
  }
  // A string that begins like a binary list reads back as that string, not as a binary list.
  for (const Value& text : {Value("bplist00"), Value("bplist00abc"), Value("bplist")}) {
    EXPECT_EQ(ReadPropertyList(Describe(text)), text) << Describe(text);
  }
}

TEST(PropertyListText, ReadsStringsTables) {
  const char* table = R"(/* Greeting */
"hello" = "Bonjour";   // trailing comment
"count %d" = "%d éléments";
bare = word;
"alone";
'single' = "a\U00e9\"b\U0041\101";
"pair" = "\UD83D\UDE00";
)";
  const std::optional<Value> value = ParseTextPropertyList(table);
  ASSERT_TRUE(value);
  const Dictionary expected{{"hello", "Bonjour"}, {"count %d", "%d éléments"}, {"bare", "word"},
                            {"alone", "alone"},   {"single", "aé\"bAA"},       {"pair", "😀"}};
  EXPECT_EQ(value->dictionary(), expected) << Describe(*value);
  // The same table in UTF-16 with a byte-order mark.
  std::string utf16 = "\xFF\xFE";
  for (char c : std::string("\"k\" = \"v\";")) utf16 += std::string{c, '\0'};
  EXPECT_EQ(ParseTextPropertyList(utf16), Value(Dictionary{{"k", "v"}}));
}

TEST(PropertyListText, ReadsTheFormsOfHandWrittenFiles) {
  struct Case {
    const char* text;
    Value expected;
  };
  const Case cases[] = {
      {"{ a = 1; b = (x, y,); }",
       Value(Dictionary{{"a", Value::Integer(1)}, {"b", Value(Array{"x", "y"})}})},
      {"{ a = 1; a = 2; b = 3; }",
       Value(Dictionary{{"a", Value::Integer(2)}, {"b", Value::Integer(3)}})},
      {"( +5, 1e3, 2.5E-1, 1.2.3, -x, 99999999999999999999 )",
       Value(Array{Value::Integer(5), Value::Real(1000), Value::Real(0.25), "1.2.3", "-x",
                   Value::Real(1e20)})},
      {"(<*I-12>, <*BY>, <*BN>, <*R+inf>, <*D2001-01-01 01:00:00 +0100>, < 0A0b >)",
       Value(Array{Value::Integer(-12), Value::Boolean(true), Value::Boolean(false),
                   Value::Real(std::numeric_limits<double>::infinity()), Value::FromDate(Date{0}),
                   Value::FromData({0x0A, 0x0B})})},
      {"\xEF\xBB\xBF  word  ", Value("word")},
  };
  for (const Case& c : cases) EXPECT_EQ(ParseTextPropertyList(c.text), c.expected) << c.text;
}

TEST(PropertyListText, RejectsMalformedText) {
  const std::string cases[] = {
      "",
      "  /* only a comment */ ",
      "{ a = 1 }",
      "{ a = 1;",
      "( a b )",
      "(a,,b)",
      "\"open",
      "/* open",
      "<0a1>",
      "<0x12>",
      "<*D2001-02-30 00:00:00 +0000>",
      "<*Rabc>",
      "<*Q1>",
      "a b",
      "\"\\UD800\"",
      "\"\\UDC00\"",
      "{ = 1; }",
      "key = ;",
      "\xFF\xFE\x00\xD8"s,  // UTF-16 with a lone surrogate
  };
  for (const std::string& text : cases) EXPECT_FALSE(ParseTextPropertyList(text)) << text;
}

TEST(PropertyListFormat, IsDetectedFromTheBytes) {
  const std::string xmlBody = "<plist version=\"1.0\"><integer>7</integer></plist>";
  EXPECT_EQ(ReadPropertyList("<?xml version=\"1.0\"?>\n" + xmlBody), Value::Integer(7));
  EXPECT_EQ(ReadPropertyList(" \n\t<!DOCTYPE plist>" + xmlBody), Value::Integer(7));
  EXPECT_EQ(ReadPropertyList("\xEF\xBB\xBF" + xmlBody), Value::Integer(7));
  EXPECT_EQ(ReadPropertyList(BinaryList({"\x10\x07"})), Value::Integer(7));
  EXPECT_EQ(ReadPropertyList("<0708>"), Value::FromData({7, 8}));
  EXPECT_EQ(ReadPropertyList("7"), Value::Integer(7));
  // The wrong root kind is the caller's business.
  EXPECT_EQ(ReadPropertyList("<plist><array/></plist>"), Value(Array{}));
}

TEST(PropertyListHostile, EveryTruncationReadsAsNoValue) {
  const std::string xml = *WriteXmlPropertyList(EveryKind());
  const std::string binary = EveryKindBinary();
  const std::string text = Describe(EveryKind());
  // Cutting only the XML's final line break loses nothing.
  for (size_t length = 0; length <= xml.find_last_not_of('\n'); ++length) {
    EXPECT_FALSE(ReadPropertyList(xml.substr(0, length))) << "XML cut at " << length;
  }
  // Fewer than eight bytes are no binary header: "bplist0" is the old-style text word.
  EXPECT_EQ(ReadPropertyList(binary.substr(0, 7)), Value("bplist0"));
  for (size_t length = 8; length < binary.size(); ++length) {
    EXPECT_FALSE(ReadPropertyList(binary.substr(0, length))) << "binary cut at " << length;
  }
  for (size_t length = 0; length < text.size(); ++length) {
    EXPECT_FALSE(ReadPropertyList(text.substr(0, length))) << "text cut at " << length;
  }
}

TEST(PropertyListHostile, InvalidUtf8AndNulReadAsNoValue) {
  const std::string cases[] = {
      "<plist><string>\xC3\x28</string></plist>",
      "<plist><dict><key>\xED\xA0\x80</key><true/></dict></plist>",
      "<plist><string>\xF4\x90\x80\x80</string></plist>",
      "\"\xC0\x80\"",
      "{ \"\xFF\" = 1; }",
      BinaryList({"\x52\xC3\x28"}),                      // "ASCII" string with bad bytes
      BinaryList({"\x61\xD8\x00"s}),                     // UTF-16 lone high surrogate
      BinaryList({"\xD1\x01\x02", "\x51\xFF", "\x09"}),  // bad key
      BinaryList({"\x53"
                  "a\0b"s}),  // NUL that libplist would cut the string at
      BinaryList({"\x61\x00\x00"s}),
      "<plist><string>a\0b</string></plist>"s,  // a raw NUL no writer could write again
      "\"a\0b\";"s,
      "( \"a\\U0000b\" )",
  };
  for (const std::string& bytes : cases) EXPECT_FALSE(ReadPropertyList(bytes)) << bytes;
}

TEST(PropertyListHostile, NestingIsLimitedInEveryEncoding) {
  const size_t limit = kMaxNestingDepth;
  using Builder = std::string (*)(size_t);
  for (Builder build : {Builder{NestedXml}, Builder{NestedText}}) {
    EXPECT_TRUE(ReadPropertyList(build(limit)));
    EXPECT_FALSE(ReadPropertyList(build(limit + 1)));
    EXPECT_FALSE(ReadPropertyList(build(100000)));
  }
  EXPECT_TRUE(ReadPropertyList(NestedBinary(limit)));
  EXPECT_FALSE(ReadPropertyList(NestedBinary(limit + 1)));
  EXPECT_FALSE(ReadPropertyList(NestedBinary(100000)));
}

TEST(PropertyListHostile, BinaryOffsetsAndReferencesAreChecked) {
  const std::string valid = BinaryList({"\xA1\x01", "\x09"});
  ASSERT_EQ(ReadPropertyList(valid), Value(Array{Value::Boolean(true)}));
  auto patched = [&](size_t at, char byte) {
    std::string bytes = valid;
    bytes[at] = byte;
    return bytes;
  };
  const size_t table = valid.size() - 32 - 2;
  const std::string cases[] = {
      patched(table, '\x7F'),                        // object offset past the data
      patched(table + 1, static_cast<char>(table)),  // object offset into the offset table
      patched(table, '\x02'),                        // object offset inside the header
      patched(valid.size() - 1, '\x7F'),             // offset table past the data
      patched(valid.size() - 1, '\x03'),             // offset table inside the header
      patched(valid.size() - 9, '\x05'),             // top object that does not exist
      patched(valid.size() - 17, '\x00'),            // no objects
      patched(valid.size() - 26, '\x03'),            // offset size 3
      patched(9, '\x05'),                            // reference to an object that does not exist
      patched(8, '\xA5'),                            // array longer than the data
      BinaryList({"\xA1\x00"s}),                     // an array that holds itself
      BinaryList({"\xA1\x01", "\xA1\x00"s}),         // two arrays that hold each other
      BinaryList({"\xD1\x01\x02", "\x10\x01", "\x09"}),  // key that is not a string
      BinaryList({"\x00"s}),                             // null is no property-list value
      BinaryList({"\x4F\x10\x7F\x00"s}),                 // data whose length runs past the end
      "bplist00",
  };
  for (const std::string& bytes : cases) EXPECT_FALSE(ReadPropertyList(bytes));
}

TEST(PropertyListHostile, SharedObjectsCannotMultiplyTheTree) {
  // Writers share equal strings: 5,000 references to one string are an ordinary file.
  const std::string shared = BinaryList({"\xAF\x11\x13\x88" + Repeat(Ref(1), 5000), "\x51x"});
  const std::optional<Value> strings = ReadPropertyList(shared);
  ASSERT_TRUE(strings);
  EXPECT_EQ(strings->array().size(), 5000u);
  // Forty arrays each holding the next one twice: a tree of 2^40 nodes from 200 bytes.
  std::vector<std::string> objects;
  for (int i = 0; i < 40; ++i) objects.push_back("\xA2" + Ref(i + 1) + Ref(i + 1));
  objects.push_back("\x09");
  EXPECT_FALSE(ReadPropertyList(BinaryList(objects)));
  // A subtree first met near the top may not sit deeper below a later reference: the root
  // holds the shared array (two levels) and a chain of `links` arrays that ends in it too.
  const auto sharedBelowChain = [](int links) {
    std::vector<std::string> chain{"\xA2" + Ref(1, 2) + Ref(3, 2), "\xA1" + Ref(2, 2), "\xA0"};
    for (int i = 1; i < links; ++i) chain.push_back("\xA1" + Ref(3 + i, 2));
    chain.push_back("\xA1" + Ref(1, 2));
    return BinaryList(chain, 2);
  };
  EXPECT_TRUE(ReadPropertyList(sharedBelowChain(kMaxNestingDepth - 3)));
  EXPECT_FALSE(ReadPropertyList(sharedBelowChain(kMaxNestingDepth - 2)));
}

// A payload object: ASCII string (0x5), data (0x4) or UTF-16 string (0x6) of `length` units.
std::string Payload(char type, size_t length) {
  const size_t bytes = type == 0x6 ? 2 * length : length;
  return std::string(1, static_cast<char>(type << 4 | 0x0F)) + "\x11" + BigEndian(length, 2) +
         std::string(bytes, type == 0x6 ? '\x01' : 'p');
}

// An array of `references` two-byte references to object 1.
std::string SharedPayloadArray(const std::string& payload, size_t references) {
  return BinaryList(
      {"\xAF\x11" + BigEndian(references, 2) + Repeat(Ref(1, 2), references), payload}, 2);
}

TEST(PropertyListHostile, SharedPayloadsAreCountedAtEveryReference) {
  // 64 KB that would expand to 1 GB: 32,000 references to one 32,000-byte payload.
  for (char type : {'\x05', '\x04', '\x06'}) {
    EXPECT_FALSE(ReadPropertyList(SharedPayloadArray(Payload(type, 32000), 32000))) << int{type};
  }
  // The same in a dictionary, where the payload is both every key and every value.
  const std::string bigKey = Payload(0x5, 32000);
  EXPECT_FALSE(
      ReadPropertyList(BinaryList({"\xDF\x11\x3E\x80" + Repeat(Ref(1, 2), 2 * 16000), bigKey}, 2)));
  // A list reads exactly while what it expands to fits MaxExpandedBytes of its size (one
  // UTF-16 unit counted as three bytes).
  for (char type : {'\x05', '\x04', '\x06'}) {
    const size_t length = 4096;
    int read = 0;
    for (size_t references = 1; references <= 80; ++references) {
      const std::string bytes = SharedPayloadArray(Payload(type, length), references);
      const uint64_t expanded = references * length * (type == 0x6 ? 3 : 1);
      EXPECT_EQ(ReadPropertyList(bytes).has_value(), expanded <= MaxExpandedBytes(bytes.size()))
          << int{type} << " x" << references;
      read += expanded <= MaxExpandedBytes(bytes.size());
    }
    EXPECT_GT(read, 5);
    EXPECT_LT(read, 80);
  }
}

TEST(PropertyListHostile, XmlScalarsMustMeanWhatTheySay) {
  const char* cases[] = {
      "<plist><integer>9223372036854775808</integer></plist>",
      "<plist><integer>-9223372036854775809</integer></plist>",
      "<plist><integer>12abc</integer></plist>",
      "<plist><integer></integer></plist>",
      "<plist><real>abc</real></plist>",
      "<plist><date>garbage</date></plist>",
      "<plist><data>!!!!</data></plist>",
      "<plist><array a=\"/>\"><true/></array></plist>",
      "<plist><array></dict></plist>",
      "<plist><true/>",
  };
  for (const char* xml : cases) EXPECT_FALSE(ReadPropertyList(xml)) << xml;
  EXPECT_EQ(ReadPropertyList("<plist><integer>-9223372036854775808</integer></plist>"),
            Value::Integer(std::numeric_limits<int64_t>::min()));
}

class PropertyListFile : public testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/plist_test.XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    mDirectory = pattern;
  }
  void TearDown() override {
    for (const char* name : {"/ok.plist", "/fifo", "/big"}) unlink((mDirectory + name).c_str());
    rmdir(mDirectory.c_str());
  }
  std::string mDirectory;
};

TEST_F(PropertyListFile, ReadsRegularFilesOnly) {
  const std::string ok = mDirectory + "/ok.plist";
  const std::string text = *WriteXmlPropertyList(EveryKind());
  FILE* file = fopen(ok.c_str(), "w");
  ASSERT_NE(file, nullptr);
  fwrite(text.data(), 1, text.size(), file);
  fclose(file);
  EXPECT_EQ(ReadPropertyListFile(ok), EveryKind());
  EXPECT_FALSE(ReadPropertyListFile(mDirectory + "/missing"));
  EXPECT_FALSE(ReadPropertyListFile(mDirectory));
  ASSERT_EQ(mkfifo((mDirectory + "/fifo").c_str(), 0600), 0);
  EXPECT_FALSE(ReadPropertyListFile(mDirectory + "/fifo"));  // and does not wait for a writer
  const int big = open((mDirectory + "/big").c_str(), O_CREAT | O_WRONLY, 0600);
  ASSERT_GE(big, 0);
  ASSERT_EQ(ftruncate(big, static_cast<off_t>(kMaxFileSize) + 1), 0);
  close(big);
  EXPECT_FALSE(ReadPropertyListFile(mDirectory + "/big"));
}

}  // namespace
}  // namespace plist
