// XML property lists through libplist, behind checks of our own; binary ones read here. libplist
// 2.2 is not built for hostile input: before it sees any bytes, the XML's nesting and scalar
// texts are checked here, and its tree is converted with a depth limit and UTF-8 validation of
// every string and key. A binary list's whole object graph (bounds, cycles, depth, expanded
// size) is checked before its value is built straight from the bytes.
#include "plist/codec.h"

#include <fcntl.h>
#include <plist/plist.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace plist {

namespace {

struct NodeDeleter {
  void operator()(void* node) const { plist_free(node); }
};
using NodePtr = std::unique_ptr<void, NodeDeleter>;

bool IsXmlBlank(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; }

std::string_view TrimXmlBlanks(std::string_view text) {
  while (!text.empty() && IsXmlBlank(text.front())) text.remove_prefix(1);
  while (!text.empty() && IsXmlBlank(text.back())) text.remove_suffix(1);
  return text;
}

// ---------------------------------------------------------------------------------------------
// XML pre-check

// libplist takes these texts loosely ("12abc" is 12, a wrong date is 1970, an integer past the
// 64-bit range wraps); a file holding such a text is malformed rather than silently altered.
bool IntegerTextFits(std::string_view text) {
  text = TrimXmlBlanks(text);
  bool negative = false;
  if (!text.empty() && (text[0] == '-' || text[0] == '+')) {
    negative = text[0] == '-';
    text.remove_prefix(1);
  }
  if (text.empty()) return false;
  uint64_t base = 10;
  if (!negative && text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    base = 16;
    text.remove_prefix(2);
  }
  uint64_t magnitude = 0;
  const uint64_t limit = negative ? uint64_t{1} << 63 : (uint64_t{1} << 63) - 1;
  for (char c : text) {
    uint64_t digit;
    if (c >= '0' && c <= '9') {
      digit = static_cast<uint64_t>(c - '0');
    } else if (base == 16 && c >= 'a' && c <= 'f') {
      digit = static_cast<uint64_t>(c - 'a' + 10);
    } else if (base == 16 && c >= 'A' && c <= 'F') {
      digit = static_cast<uint64_t>(c - 'A' + 10);
    } else {
      return false;
    }
    if (magnitude > (limit - digit) / base) return false;
    magnitude = magnitude * base + digit;
  }
  return true;
}

bool RealTextIsNumber(std::string_view text) {
  text = TrimXmlBlanks(text);
  if (!text.empty() && (text[0] == '-' || text[0] == '+')) text.remove_prefix(1);
  if (text == "nan" || text == "inf" || text == "infinity") return true;
  bool digits = false;
  size_t i = 0;
  while (i < text.size() && text[i] >= '0' && text[i] <= '9') ++i, digits = true;
  if (i < text.size() && text[i] == '.') {
    ++i;
    while (i < text.size() && text[i] >= '0' && text[i] <= '9') ++i, digits = true;
  }
  if (!digits) return false;
  if (i < text.size() && (text[i] == 'e' || text[i] == 'E')) {
    ++i;
    if (i < text.size() && (text[i] == '-' || text[i] == '+')) ++i;
    const size_t exponent = i;
    while (i < text.size() && text[i] >= '0' && text[i] <= '9') ++i;
    if (i == exponent) return false;
  }
  return i == text.size();
}

// libplist writes the year without leading zeros ("1-01-01T00:00:00Z" for year 1).
std::optional<Date> ParseXmlDate(std::string_view text) {
  text = TrimXmlBlanks(text);
  const size_t yearDigits = text.find('-');
  if (yearDigits == 0 || yearDigits > 4 || yearDigits == std::string_view::npos) {
    return std::nullopt;
  }
  return ParseDate(std::string(4 - yearDigits, '0') + std::string(text));
}

bool Base64TextIsValid(std::string_view text) {
  for (char c : text) {
    const bool ok = (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') ||
                    c == '+' || c == '/' || c == '=' || IsXmlBlank(c);
    if (!ok) return false;
  }
  return true;
}

// Walks the markup once: containers may nest at most kMaxNestingDepth deep and must close in
// order, array and dict tags carry no attributes (so no quoted ">" can hide a tag from this
// count), the plist element that opens must close (a truncated file is refused), and integer,
// real, date and data texts must be what they claim.
bool XmlShapeIsSafe(std::string_view xml) {
  std::vector<char> open;  // 'a' for array, 'd' for dict
  bool plistOpened = false;
  bool plistClosed = false;
  size_t pos = 0;
  while (true) {
    pos = xml.find('<', pos);
    if (pos == std::string_view::npos) break;
    const std::string_view rest = xml.substr(pos);
    size_t end;
    if (rest.starts_with("<!--")) {
      end = xml.find("-->", pos + 4);
      if (end == std::string_view::npos) return false;
      pos = end + 3;
      continue;
    }
    if (rest.starts_with("<![CDATA[")) {
      end = xml.find("]]>", pos + 9);
      if (end == std::string_view::npos) return false;
      pos = end + 3;
      continue;
    }
    if (rest.starts_with("<?")) {
      end = xml.find("?>", pos + 2);
      if (end == std::string_view::npos) return false;
      pos = end + 2;
      continue;
    }
    end = xml.find('>', pos);
    if (end == std::string_view::npos) return false;
    const std::string_view tag = xml.substr(pos + 1, end - pos - 1);  // between < and >
    pos = end + 1;
    if (tag.empty() || IsXmlBlank(tag[0])) return false;
    if (tag[0] == '!') continue;  // DOCTYPE
    if (tag[0] == '/') {
      const std::string_view name = TrimXmlBlanks(tag.substr(1));
      if (name == "array" || name == "dict") {
        if (open.empty() || open.back() != name[0]) return false;
        open.pop_back();
      } else if (name == "plist") {
        plistClosed = true;
      }
      continue;
    }
    size_t nameEnd = 0;
    while (nameEnd < tag.size() && !IsXmlBlank(tag[nameEnd]) && tag[nameEnd] != '/') ++nameEnd;
    const std::string_view name = tag.substr(0, nameEnd);
    const bool selfClosing = tag.back() == '/';
    if (name == "array" || name == "dict") {
      if (TrimXmlBlanks(tag.substr(nameEnd)) != (selfClosing ? "/" : "")) return false;
      // An empty container still counts as one level.
      if (open.size() + 1 > static_cast<size_t>(kMaxNestingDepth)) return false;
      if (!selfClosing) open.push_back(name[0]);
      continue;
    }
    if (name == "plist") {
      plistOpened = true;
      continue;
    }
    if (name == "integer" || name == "real" || name == "date" || name == "data") {
      if (selfClosing) {
        if (name != "data") return false;
        continue;
      }
      size_t textEnd = xml.find('<', pos);
      if (textEnd == std::string_view::npos) return false;
      const std::string_view text = xml.substr(pos, textEnd - pos);
      const bool ok = name == "integer" ? IntegerTextFits(text)
                      : name == "real"  ? RealTextIsNumber(text)
                      : name == "date"  ? ParseXmlDate(text).has_value()
                                        : Base64TextIsValid(text);
      if (!ok) return false;
    }
  }
  return plistOpened == plistClosed && open.empty();
}

// ---------------------------------------------------------------------------------------------
// Binary pre-check

constexpr std::string_view kBinaryMagic = "bplist00";
constexpr size_t kTrailerSize = 32;
// 0001-01-01 00:00:00 and 10000-01-01 00:00:00 UTC in seconds since 2001.
constexpr double kFirstDateSeconds = -63113904000.0;
constexpr double kPastLastDateSeconds = 252423993600.0;

uint64_t ReadBigEndian(const uint8_t* p, size_t size) {
  uint64_t value = 0;
  for (size_t i = 0; i < size; ++i) value = value << 8 | p[i];
  return value;
}

bool IsPowerOfTwoUpTo8(uint64_t n) { return n == 1 || n == 2 || n == 4 || n == 8; }

// Checks the object graph of a binary list the way the reader will walk it, without recursion:
// the trailer and offset table lie inside the data, every reachable object lies between the
// header and the offset table with all its bytes, references name existing objects, no object
// contains itself, containers nest at most kMaxNestingDepth deep, and the value built from it
// (a shared object is copied at every reference) stays within a budget proportional to the
// input, both in nodes and in the bytes of the strings, keys and data it copies. Integers
// must fit in 64 bits and UTF-16 strings must pair their surrogates.
class BinaryChecker {
 public:
  explicit BinaryChecker(std::string_view bytes)
      : mData(reinterpret_cast<const uint8_t*>(bytes.data())), mSize(bytes.size()) {}

  // The list's value once check() has passed; the check's bookkeeping is freed first.
  std::optional<Value> read() {
    mNodes = {};
    return valueOf(mTop, 0);
  }

  bool check() {
    if (mSize < kBinaryMagic.size() + 1 + kTrailerSize) return false;
    const uint8_t* trailer = mData + mSize - kTrailerSize;
    mOffsetSize = trailer[6];
    mRefSize = trailer[7];
    const uint64_t count = ReadBigEndian(trailer + 8, 8);
    const uint64_t top = ReadBigEndian(trailer + 16, 8);
    const uint64_t tableOffset = ReadBigEndian(trailer + 24, 8);
    if (!IsPowerOfTwoUpTo8(mOffsetSize) || !IsPowerOfTwoUpTo8(mRefSize)) return false;
    const uint64_t tableLimit = mSize - kTrailerSize;
    if (count == 0 || top >= count || tableOffset <= kBinaryMagic.size() ||
        tableOffset > tableLimit || count > (tableLimit - tableOffset) / mOffsetSize) {
      return false;
    }
    mObjectsEnd = tableOffset;
    mTable = mData + tableOffset;
    mCount = count;
    mTop = top;
    // Without shared containers every expanded node but the top one is a reference of at
    // least one byte, so one node per input byte admits every such file; a shared container
    // copied at each of its references cannot multiply the tree beyond that.
    mBudget = static_cast<uint64_t>(mSize) + 1024;
    // A node is cheap to count but a shared string or data object is copied whole at every
    // reference: one reference byte can stand for kilobytes, so payload bytes have their own
    // budget.
    mByteBudget = MaxExpandedBytes(mSize);
    static_assert(kMaxFileSize + 1024 < (uint64_t{1} << 32), "expanded sizes are kept in 32 bits");
    static_assert(kMaxExpansionFactor * kMaxFileSize + kExpansionAllowance < (uint64_t{1} << 32),
                  "expanded byte sizes are kept in 32 bits");
    mNodes.assign(count, Node{});
    return walk(top);
  }

 private:
  enum State : uint8_t { kUnvisited, kOnPath, kDone };

  struct Object {
    uint8_t type = 0;      // high nibble of the marker
    uint8_t low = 0;       // low nibble of the marker
    uint64_t count = 0;    // elements, characters or bytes
    uint64_t payload = 0;  // offset of the first byte after marker and count
  };

  struct Frame {
    uint64_t index;
    Object object;
    uint64_t refs;  // references the container holds
    uint64_t next;  // the next of them to visit
    uint64_t expanded;
    uint64_t bytes;  // payload bytes of the expanded subtree
    uint32_t height;
  };

  // Marker, count and payload bounds of an object; false when any of it lies outside.
  bool readObject(uint64_t index, Object& out) const {
    const uint64_t offset = ReadBigEndian(mTable + index * mOffsetSize, mOffsetSize);
    if (offset < kBinaryMagic.size() || offset >= mObjectsEnd) return false;
    const uint8_t marker = mData[offset];
    out.type = marker >> 4;
    const uint8_t low = marker & 0x0F;
    out.low = low;
    uint64_t pos = offset + 1;
    const auto available = [&](uint64_t bytes) { return bytes <= mObjectsEnd - pos; };
    switch (out.type) {
      case 0x0:  // only false and true; null, fill and the rest are not property-list values
        out.payload = pos;
        return marker == 0x08 || marker == 0x09;
      case 0x1: {  // integer of 2^low bytes
        if (low > 4 || !available(uint64_t{1} << low)) return false;
        out.payload = pos;
        out.count = uint64_t{1} << low;
        if (low == 4) {
          // 128 bits: only values that fit in 64 bits, high half a sign extension of the low.
          const uint64_t high = ReadBigEndian(mData + pos, 8);
          const uint64_t lowHalf = ReadBigEndian(mData + pos + 8, 8);
          const uint64_t extension = (lowHalf >> 63) ? ~uint64_t{0} : 0;
          if (high != extension) return false;
        }
        return true;
      }
      case 0x2:  // real of 4 or 8 bytes
        out.payload = pos;
        return (low == 2 || low == 3) && available(uint64_t{1} << low);
      case 0x3:  // date
        out.payload = pos;
        return low == 3 && available(8);
      case 0x4:    // data
      case 0x5:    // ASCII string
      case 0x6:    // UTF-16 string
      case 0x8:    // UID
      case 0xA:    // array
      case 0xD: {  // dictionary
        if (out.type == 0x8) {
          out.payload = pos;
          out.count = low + 1u;
          return low < 8 && available(out.count);
        }
        uint64_t count = low;
        if (low == 0x0F) {
          if (!available(1)) return false;
          const uint8_t intMarker = mData[pos];
          if ((intMarker >> 4) != 0x1 || (intMarker & 0x0F) > 3) return false;
          const uint64_t size = uint64_t{1} << (intMarker & 0x0F);
          ++pos;
          if (!available(size)) return false;
          count = ReadBigEndian(mData + pos, size);
          pos += size;
        }
        const uint64_t unit = out.type == 0x6   ? 2
                              : out.type == 0xA ? mRefSize
                              : out.type == 0xD ? 2 * uint64_t{mRefSize}
                                                : 1;
        if (count > (mObjectsEnd - pos) / unit) return false;
        out.count = count;
        out.payload = pos;
        if (out.type == 0x6) return utf16IsPaired(pos, count);
        // No NUL: XML could not hold the string, and libplist would cut it there.
        if (out.type == 0x5) return std::memchr(mData + pos, 0, count) == nullptr;
        return true;
      }
      default:
        return false;
    }
  }

  // Surrogates come in pairs, and no NUL (see the ASCII case above).
  bool utf16IsPaired(uint64_t pos, uint64_t units) const {
    for (uint64_t i = 0; i < units; ++i) {
      const uint64_t u = ReadBigEndian(mData + pos + 2 * i, 2);
      if (u == 0 || (u >= 0xDC00 && u <= 0xDFFF)) return false;
      if (u >= 0xD800 && u <= 0xDBFF) {
        if (i + 1 >= units) return false;
        const uint64_t next = ReadBigEndian(mData + pos + 2 * (i + 1), 2);
        if (next < 0xDC00 || next > 0xDFFF) return false;
        ++i;
      }
    }
    return true;
  }

  uint64_t refAt(const Frame& frame, uint64_t k) const {
    return ReadBigEndian(mData + frame.object.payload + k * mRefSize, mRefSize);
  }

  static bool IsContainer(uint8_t type) { return type == 0xA || type == 0xD; }

  // The bytes one reference to a leaf copies into the value: the data, or the string's text (a
  // UTF-16 unit becomes at most three bytes of UTF-8).
  static uint64_t PayloadBytes(const Object& object) {
    switch (object.type) {
      case 0x4:
      case 0x5:
        return object.count;
      case 0x6:
        return 3 * object.count;
      default:
        return 0;
    }
  }

  // Adds a finished child to its parent; false when a budget or the depth is exceeded.
  bool addChild(Frame& parent, uint64_t expanded, uint64_t bytes, uint32_t height) {
    parent.expanded += expanded;
    parent.bytes += bytes;
    if (parent.expanded > mBudget || parent.bytes > mByteBudget) return false;
    if (height + 1 > parent.height) parent.height = height + 1;
    return true;
  }

  bool walk(uint64_t top) {
    std::vector<Frame> stack;
    Object object;
    if (!readObject(top, object)) return false;
    if (!IsContainer(object.type)) return PayloadBytes(object) <= mByteBudget;
    const auto push = [&](uint64_t index, const Object& o) {
      mNodes[index].state = kOnPath;
      const uint64_t refs = o.type == 0xD ? 2 * o.count : o.count;
      stack.push_back(Frame{index, o, refs, 0, 1, 0, 1});
    };
    push(top, object);
    while (!stack.empty()) {
      Frame& frame = stack.back();
      if (frame.next == frame.refs) {
        const Frame done = frame;
        stack.pop_back();
        mNodes[done.index].state = kDone;
        mNodes[done.index].expanded = static_cast<uint32_t>(done.expanded);
        mNodes[done.index].expandedBytes = static_cast<uint32_t>(done.bytes);
        mNodes[done.index].height = static_cast<uint16_t>(done.height);
        if (!stack.empty() && !addChild(stack.back(), done.expanded, done.bytes, done.height)) {
          return false;
        }
        continue;
      }
      const uint64_t k = frame.next++;
      const uint64_t child = refAt(frame, k);
      if (child >= mCount) return false;
      const bool isKey = frame.object.type == 0xD && k < frame.object.count;
      if (mNodes[child].state == kOnPath) return false;  // an object that contains itself
      if (mNodes[child].state == kDone) {
        if (isKey && !isStringObject(child)) return false;
        // A shared container nests as deep below this reference as below its first one.
        if (stack.size() + mNodes[child].height > static_cast<size_t>(kMaxNestingDepth))
          return false;
        if (!addChild(frame, mNodes[child].expanded, mNodes[child].expandedBytes,
                      mNodes[child].height)) {
          return false;
        }
        continue;
      }
      if (!readObject(child, object)) return false;
      if (isKey && object.type != 0x5 && object.type != 0x6) return false;
      if (IsContainer(object.type)) {
        if (stack.size() + 1 > static_cast<size_t>(kMaxNestingDepth)) return false;
        push(child, object);  // invalidates frame
        continue;
      }
      mNodes[child].state = kDone;
      mNodes[child].expanded = 1;
      mNodes[child].expandedBytes = static_cast<uint32_t>(PayloadBytes(object));
      mNodes[child].height = 0;
      if (!addChild(frame, 1, mNodes[child].expandedBytes, 0)) return false;
    }
    return true;
  }

  static void AppendUtf8(std::string& out, uint32_t c) {
    if (c < 0x80) {
      out += static_cast<char>(c);
    } else if (c < 0x800) {
      out += static_cast<char>(0xC0 | c >> 6);
      out += static_cast<char>(0x80 | (c & 0x3F));
    } else if (c < 0x10000) {
      out += static_cast<char>(0xE0 | c >> 12);
      out += static_cast<char>(0x80 | (c >> 6 & 0x3F));
      out += static_cast<char>(0x80 | (c & 0x3F));
    } else {
      out += static_cast<char>(0xF0 | c >> 18);
      out += static_cast<char>(0x80 | (c >> 12 & 0x3F));
      out += static_cast<char>(0x80 | (c >> 6 & 0x3F));
      out += static_cast<char>(0x80 | (c & 0x3F));
    }
  }

  // The text of a checked string object; nullopt when it is not UTF-8.
  std::optional<std::string> textOf(const Object& o) const {
    const uint8_t* p = mData + o.payload;
    std::string text;
    if (o.type == 0x5) {
      text.assign(reinterpret_cast<const char*>(p), o.count);
      if (!IsValidUtf8(text)) return std::nullopt;
      return text;
    }
    text.reserve(o.count);
    for (uint64_t i = 0; i < o.count; ++i) {
      uint32_t c = static_cast<uint32_t>(ReadBigEndian(p + 2 * i, 2));
      if (c >= 0xD800 && c <= 0xDBFF) {  // paired, as the check made sure
        const uint32_t next = static_cast<uint32_t>(ReadBigEndian(p + 2 * ++i, 2));
        c = 0x10000 + ((c - 0xD800) << 10) + (next - 0xDC00);
      }
      AppendUtf8(text, c);
    }
    return text;
  }

  // The value of an object of a checked list, read straight from the bytes: going through
  // libplist's tree would cost another hundred bytes or more per node on top of the value's.
  // depth: the containers around it; the check bounds it already.
  std::optional<Value> valueOf(uint64_t index, int depth) const {
    Object o;
    if (!readObject(index, o)) return std::nullopt;
    const uint8_t* p = mData + o.payload;
    switch (o.type) {
      case 0x0:
        return Value::Boolean(o.low == 0x9);
      case 0x1: {
        // Stored as the 64-bit pattern: 8 and 16 bytes read as signed, fewer as unsigned. The
        // high half of 16 bytes is the sign extension of the low half.
        const uint64_t bits = o.count == 16 ? ReadBigEndian(p + 8, 8) : ReadBigEndian(p, o.count);
        return Value::Integer(static_cast<int64_t>(bits));
      }
      case 0x2: {
        if (o.low == 2) {
          const uint32_t bits = static_cast<uint32_t>(ReadBigEndian(p, 4));
          float f;
          std::memcpy(&f, &bits, sizeof f);
          return Value::Real(f);
        }
        const uint64_t bits = ReadBigEndian(p, 8);
        double d;
        std::memcpy(&d, &bits, sizeof d);
        return Value::Real(d);
      }
      case 0x3: {
        const uint64_t bits = ReadBigEndian(p, 8);
        double seconds;
        std::memcpy(&seconds, &bits, sizeof seconds);
        // Years 1 to 9999, the dates every other form can hold.
        if (!(seconds >= kFirstDateSeconds && seconds < kPastLastDateSeconds)) return std::nullopt;
        return Value::FromDate(Date{seconds});
      }
      case 0x4:
        return Value::FromData(Data(p, p + o.count));
      case 0x5:
      case 0x6: {
        std::optional<std::string> text = textOf(o);
        if (!text) return std::nullopt;
        return Value(std::move(*text));
      }
      case 0x8:
        // A keyed-archive reference; written in XML as this very dictionary.
        return Value(Dictionary{
            {"CF$UID", Value::Integer(static_cast<int64_t>(ReadBigEndian(p, o.count)))}});
      case 0xA: {
        if (depth >= kMaxNestingDepth) return std::nullopt;
        Array array;
        array.reserve(o.count);
        for (uint64_t k = 0; k < o.count; ++k) {
          std::optional<Value> item = valueOf(ReadBigEndian(p + k * mRefSize, mRefSize), depth + 1);
          if (!item) return std::nullopt;
          array.push_back(std::move(*item));
        }
        return Value(std::move(array));
      }
      case 0xD: {
        if (depth >= kMaxNestingDepth) return std::nullopt;
        std::vector<Dictionary::Entry> entries;
        entries.reserve(o.count);
        const uint8_t* values = p + o.count * mRefSize;
        for (uint64_t k = 0; k < o.count; ++k) {
          Object key;
          if (!readObject(ReadBigEndian(p + k * mRefSize, mRefSize), key)) return std::nullopt;
          std::optional<std::string> keyText = textOf(key);
          if (!keyText) return std::nullopt;
          std::optional<Value> item =
              valueOf(ReadBigEndian(values + k * mRefSize, mRefSize), depth + 1);
          if (!item) return std::nullopt;
          entries.emplace_back(std::move(*keyText), std::move(*item));
        }
        return Value(Dictionary::FromEntries(std::move(entries)));
      }
      default:
        return std::nullopt;
    }
  }

  bool isStringObject(uint64_t index) const {
    Object object;
    return readObject(index, object) && (object.type == 0x5 || object.type == 0x6);
  }

  const uint8_t* mData;
  uint64_t mSize;
  uint8_t mOffsetSize = 0;
  uint8_t mRefSize = 0;
  uint64_t mObjectsEnd = 0;
  const uint8_t* mTable = nullptr;
  uint64_t mCount = 0;
  uint64_t mTop = 0;
  uint64_t mBudget = 0;
  uint64_t mByteBudget = 0;
  // Per declared object, so kept narrow (and in one allocation): heights are at most
  // kMaxNestingDepth and expanded sizes at most their budgets, which are below 2^32 for any
  // input within kMaxFileSize.
  struct Node {
    uint32_t expanded = 0;
    uint32_t expandedBytes = 0;
    uint16_t height = 0;
    State state = kUnvisited;
  };
  std::vector<Node> mNodes;
};

// ---------------------------------------------------------------------------------------------
// libplist tree -> Value

std::optional<Date> DateFromNodeText(plist_t node);

std::optional<Date> DateOfNode(plist_t node) {
  int32_t seconds = 0;
  int32_t microseconds = 0;
  plist_get_date_val(node, &seconds, &microseconds);
  // libplist 2.2 keeps the date as a double but hands it out as 32-bit seconds: a date outside
  // 1933..2069 comes out as INT32_MIN. Its XML text still carries the whole seconds.
  if (seconds == std::numeric_limits<int32_t>::min()) return DateFromNodeText(node);
  // The seconds are truncated toward zero and the microseconds are their magnitude.
  const double fraction = microseconds / 1e6;
  return Date{seconds < 0 ? seconds - fraction : seconds + fraction};
}

std::optional<Date> DateFromNodeText(plist_t node) {
  NodePtr copy(plist_copy(node));
  if (!copy) return std::nullopt;
  char* xml = nullptr;
  uint32_t length = 0;
  plist_to_xml(copy.get(), &xml, &length);
  if (!xml) return std::nullopt;
  const std::string text(xml, length);
  plist_to_xml_free(xml);
  const size_t open = text.find("<date>");
  const size_t close = text.find("</date>");
  if (open == std::string::npos || close == std::string::npos || close < open) return std::nullopt;
  return ParseXmlDate(std::string_view(text).substr(open + 6, close - open - 6));
}

std::optional<std::string> StringOfNode(plist_t node) {
  uint64_t length = 0;
  const char* text = plist_get_string_ptr(node, &length);
  if (!text) return std::string();
  std::string s(text, length);
  // A NUL written into XML text as a raw byte: refused as the binary reader refuses it, since
  // no writer could write the string again (a saved state holding one could not be saved).
  if (s.find('\0') != std::string::npos || !IsValidUtf8(s)) return std::nullopt;
  return s;
}

// depth: the number of containers around the node. The pre-checks bound the depth already;
// the count here keeps the conversion safe on its own.
std::optional<Value> ValueOfNode(plist_t node, int depth) {
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      uint8_t b = 0;
      plist_get_bool_val(node, &b);
      return Value::Boolean(b != 0);
    }
    case PLIST_UINT: {
      // Integers are stored as their 64-bit pattern: a negative one reads back as itself.
      uint64_t u = 0;
      plist_get_uint_val(node, &u);
      return Value::Integer(static_cast<int64_t>(u));
    }
    case PLIST_REAL: {
      double d = 0;
      plist_get_real_val(node, &d);
      return Value::Real(d);
    }
    case PLIST_DATE: {
      std::optional<Date> date = DateOfNode(node);
      if (!date) return std::nullopt;
      return Value::FromDate(*date);
    }
    case PLIST_DATA: {
      uint64_t length = 0;
      const char* bytes = plist_get_data_ptr(node, &length);
      const auto* begin = reinterpret_cast<const uint8_t*>(bytes);
      return Value::FromData(bytes ? Data(begin, begin + length) : Data());
    }
    case PLIST_STRING:
    case PLIST_KEY: {
      std::optional<std::string> s = StringOfNode(node);
      if (!s) return std::nullopt;
      return Value(std::move(*s));
    }
    case PLIST_UID: {
      // A keyed-archive reference; written in XML as this very dictionary.
      uint64_t uid = 0;
      plist_get_uid_val(node, &uid);
      return Value(Dictionary{{"CF$UID", Value::Integer(static_cast<int64_t>(uid))}});
    }
    case PLIST_ARRAY: {
      if (depth >= kMaxNestingDepth) return std::nullopt;
      Array array;
      array.reserve(plist_array_get_size(node));
      plist_array_iter iter = nullptr;
      plist_array_new_iter(node, &iter);
      bool ok = iter != nullptr;
      while (ok) {
        plist_t item = nullptr;
        plist_array_next_item(node, iter, &item);
        if (!item) break;
        std::optional<Value> value = ValueOfNode(item, depth + 1);
        if (!value) ok = false;
        if (ok) array.push_back(std::move(*value));
      }
      std::free(iter);
      if (!ok) return std::nullopt;
      return Value(std::move(array));
    }
    case PLIST_DICT: {
      if (depth >= kMaxNestingDepth) return std::nullopt;
      std::vector<Dictionary::Entry> entries;
      entries.reserve(plist_dict_get_size(node));
      plist_dict_iter iter = nullptr;
      plist_dict_new_iter(node, &iter);
      bool ok = iter != nullptr;
      while (ok) {
        char* key = nullptr;
        plist_t item = nullptr;
        plist_dict_next_item(node, iter, &key, &item);
        if (!item) {
          std::free(key);
          break;
        }
        std::string keyText = key ? key : "";
        std::free(key);
        if (!IsValidUtf8(keyText)) ok = false;
        std::optional<Value> value;
        if (ok) value = ValueOfNode(item, depth + 1);
        if (!value) ok = false;
        if (ok) entries.emplace_back(std::move(keyText), std::move(*value));
      }
      std::free(iter);
      if (!ok) return std::nullopt;
      return Value(Dictionary::FromEntries(std::move(entries)));
    }
    default:
      return std::nullopt;
  }
}

// ---------------------------------------------------------------------------------------------
// Value -> libplist tree

// A text XML can hold and our readers accept: no NUL (libplist keeps C strings) and UTF-8.
bool IsWritableText(const std::string& s) {
  return s.find('\0') == std::string::npos && IsValidUtf8(s);
}

NodePtr DateNode(Date date) {
  const double seconds = std::floor(date.secondsSince2001);
  if (!std::isfinite(seconds)) return nullptr;
  if (seconds >= std::numeric_limits<int32_t>::min() + 1.0 &&
      seconds <= std::numeric_limits<int32_t>::max()) {
    return NodePtr(plist_new_date(static_cast<int32_t>(seconds), 0));
  }
  // libplist 2.2 builds dates only from 32-bit seconds; its XML reader takes any year, so a
  // date outside that range is made from its XML text.
  const double unixSeconds = seconds + kUnixTimeOfReferenceDate;
  if (unixSeconds < -62135596800.0 || unixSeconds > 253402300799.0) return nullptr;  // 1..9999
  const std::string formatted = FormatDate(Date{seconds}, false);  // "YYYY-MM-DD HH:MM:SS +0000"
  const std::string xml = "<plist><date>" + formatted.substr(0, 10) + "T" +
                          formatted.substr(11, 8) + "Z</date></plist>";
  plist_t node = nullptr;
  plist_from_xml(xml.data(), static_cast<uint32_t>(xml.size()), &node);
  return NodePtr(node);
}

NodePtr NodeOfValue(const Value& value, int depth) {
  switch (value.kind()) {
    case Value::Kind::kString:
      if (!IsWritableText(value.string())) return nullptr;
      return NodePtr(plist_new_string(value.string().c_str()));
    case Value::Kind::kInteger:
      return NodePtr(plist_new_uint(static_cast<uint64_t>(value.integer())));
    case Value::Kind::kReal:
      return NodePtr(plist_new_real(value.real()));
    case Value::Kind::kBoolean:
      return NodePtr(plist_new_bool(value.boolean() ? 1 : 0));
    case Value::Kind::kDate:
      return DateNode(value.date());
    case Value::Kind::kData: {
      const Data& data = value.data();
      static const char kNoBytes = 0;
      const char* bytes = data.empty() ? &kNoBytes : reinterpret_cast<const char*>(data.data());
      return NodePtr(plist_new_data(bytes, data.size()));
    }
    case Value::Kind::kArray: {
      // Deeper than the readers accept would write a file nothing can read back.
      if (depth >= kMaxNestingDepth) return nullptr;
      NodePtr array(plist_new_array());
      for (const Value& item : value.array()) {
        NodePtr child = NodeOfValue(item, depth + 1);
        if (!child) return nullptr;
        plist_array_append_item(array.get(), child.release());
      }
      return array;
    }
    case Value::Kind::kDictionary: {
      if (depth >= kMaxNestingDepth) return nullptr;
      NodePtr dictionary(plist_new_dict());
      for (const auto& [key, item] : value.dictionary()) {
        if (!IsWritableText(key)) return nullptr;
        NodePtr child = NodeOfValue(item, depth + 1);
        if (!child) return nullptr;
        plist_dict_set_item(dictionary.get(), key.c_str(), child.release());
      }
      return dictionary;
    }
  }
  return nullptr;
}

// ---------------------------------------------------------------------------------------------

std::optional<Value> ReadXml(std::string_view xml) {
  if (!XmlShapeIsSafe(xml)) return std::nullopt;
  plist_t root = nullptr;
  plist_from_xml(xml.data(), static_cast<uint32_t>(xml.size()), &root);
  if (!root) return std::nullopt;
  NodePtr owner(root);
  return ValueOfNode(root, 0);
}

std::optional<Value> ReadBinary(std::string_view bytes) {
  BinaryChecker checker(bytes);
  if (!checker.check()) return std::nullopt;
  return checker.read();
}

}  // namespace

std::optional<Value> ReadPropertyList(std::string_view bytes) {
  if (bytes.size() > kMaxFileSize) return std::nullopt;
  if (bytes.starts_with(kBinaryMagic)) return ReadBinary(bytes);
  size_t start = bytes.starts_with("\xEF\xBB\xBF") ? 3 : 0;
  while (start < bytes.size() && IsXmlBlank(bytes[start])) ++start;
  const std::string_view rest = bytes.substr(start);
  if (rest.starts_with("<?xml") || rest.starts_with("<!DOCTYPE") || rest.starts_with("<plist")) {
    return ReadXml(rest);
  }
  return ParseTextPropertyList(bytes);
}

std::optional<Value> ReadPropertyListFile(const std::string& path) {
  // Non-blocking open so that a FIFO in the path cannot stall the caller; only regular files
  // are read.
  const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
  if (fd < 0) return std::nullopt;
  struct stat status {};
  if (fstat(fd, &status) != 0 || !S_ISREG(status.st_mode) ||
      static_cast<uint64_t>(status.st_size) > kMaxFileSize) {
    close(fd);
    return std::nullopt;
  }
  std::string bytes;
  bytes.resize(static_cast<size_t>(status.st_size));
  size_t done = 0;
  bool ok = true;
  while (done < bytes.size()) {
    const ssize_t n = read(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      // A file that shrank while being read is read as far as it goes; an error ends it.
      ok = n == 0;
      break;
    }
    done += static_cast<size_t>(n);
  }
  close(fd);
  if (!ok) return std::nullopt;
  bytes.resize(done);
  return ReadPropertyList(bytes);
}

std::optional<std::string> WriteXmlPropertyList(const Value& value) {
  NodePtr root = NodeOfValue(value, 0);
  if (!root) return std::nullopt;
  char* xml = nullptr;
  uint32_t length = 0;
  plist_to_xml(root.get(), &xml, &length);
  if (!xml) return std::nullopt;
  std::string text(xml, length);
  plist_to_xml_free(xml);
  return text;
}

}  // namespace plist
