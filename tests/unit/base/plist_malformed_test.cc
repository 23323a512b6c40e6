// The property-list readers against hostile documents: every one must be refused with
// an error text, quickly, without crashing. Binary documents are assembled object by
// object so each test can say exactly which structure is broken.
#include <gtest/gtest.h>

#include <chrono>
#include <string>

#include "base/plist.h"
#include "plist_test_util.h"

namespace brisvale::plist {
namespace {

void PutBE(Bytes& out, uint64_t n, size_t width) {
  for (size_t i = width; i-- > 0;) out.push_back(static_cast<uint8_t>(n >> (8 * i)));
}

// "bplist00", the objects, a table of 4-byte offsets and the trailer.
Bytes Assemble(const std::vector<Bytes>& objects, uint64_t top = 0,
               std::optional<uint64_t> count = {}, uint8_t offsetSize = 4, uint8_t refSize = 4) {
  Bytes out{'b', 'p', 'l', 'i', 's', 't', '0', '0'};
  std::vector<uint64_t> offsets;
  for (const Bytes& object : objects) {
    offsets.push_back(out.size());
    out.insert(out.end(), object.begin(), object.end());
  }
  const uint64_t table = out.size();
  for (uint64_t offset : offsets) PutBE(out, offset, offsetSize);
  out.insert(out.end(), 6, 0);
  out.push_back(offsetSize);
  out.push_back(refSize);
  PutBE(out, count.value_or(objects.size()), 8);
  PutBE(out, top, 8);
  PutBE(out, table, 8);
  return out;
}

// An array or dictionary marker followed by 4-byte references.
Bytes Container(uint8_t marker, std::vector<uint32_t> refs) {
  Bytes out{static_cast<uint8_t>(marker | (marker == 0xD0 ? refs.size() / 2 : refs.size()))};
  for (uint32_t ref : refs) PutBE(out, ref, 4);
  return out;
}

void ExpectRefused(std::span<const uint8_t> bytes, const std::string& what) {
  SCOPED_TRACE(what);
  const auto start = std::chrono::steady_clock::now();
  std::string error;
  EXPECT_FALSE(Read(bytes, &error));
  EXPECT_FALSE(error.empty());
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
}

TEST(PlistMalformed, BinaryStructureIsChecked) {
  const Bytes ascii{0x51, 'a'};
  const struct {
    const char* what;
    Bytes document;
  } cases[] = {
      {"self as dictionary key", Assemble({Container(0xD0, {0, 1}), ascii})},
      {"reference out of range", Assemble({Container(0xA0, {7})})},
      {"top object out of range", Assemble({ascii}, 1)},
      {"object count of 2^32", Assemble({ascii}, 0, uint64_t{1} << 32)},
      {"object count past the table", Assemble({ascii}, 0, 3)},
      {"reference size 9", Assemble({Container(0xA0, {})}, 0, {}, 4, 9)},
      {"string past the offset table", Assemble({{0x5F, 0x10, 0xFF, 'a'}})},
      {"count of 2^63 elements", Assemble({{0xAF, 0x13, 0x80, 0, 0, 0, 0, 0, 0, 0}})},
      {"lone high surrogate", Assemble({{0x61, 0xD8, 0x3D}})},
      {"lone low surrogate", Assemble({{0x62, 0xDE, 0x00, 0x00, 'a'}})},
      {"high surrogate before a letter", Assemble({{0x62, 0xD8, 0x3D, 0x00, 'a'}})},
      {"non-ASCII byte in ASCII string", Assemble({{0x51, 0xE9}})},
      {"key that is not a string", Assemble({Container(0xD0, {1, 1}), {0x10, 1}})},
      {"duplicate key", Assemble({Container(0xD0, {1, 1, 2, 2}), ascii, ascii})},
      {"32-byte integer", Assemble({{0x15}})},
      {"date that is not a number", Assemble({{0x33, 0xFF, 0xF8, 0, 0, 0, 0, 0, 0}})},
      {"128-bit integer beyond 64 bits", Assemble({{0x14, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 0,
                                                    0, 0, 0, 0}})},
      {"null object", Assemble({{0x00}})},
      {"unknown marker", Assemble({{0x70}})},
  };
  for (const auto& c : cases) ExpectRefused(c.document, c.what);

  Bytes offsetPastEnd = Assemble({ascii});
  offsetPastEnd[offsetPastEnd.size() - 33] = 0xF0;  // the one offset entry
  ExpectRefused(offsetPastEnd, "offset past the end");
}

TEST(PlistMalformed, DeepOrExplosiveBinaryNesting) {
  // 10,000 arrays, each holding the next.
  std::vector<Bytes> deep;
  for (uint32_t i = 0; i < 10000; ++i) {
    deep.push_back(i + 1 < 10000 ? Container(0xA0, {i + 1}) : Bytes{0xA0});
  }
  ExpectRefused(Assemble(deep), "10,000-deep nesting");

  // 64 levels of [previous, previous]: a few hundred bytes that expand to 2^64 nodes.
  std::vector<Bytes> doubling{{0x10, 0}};
  for (uint32_t i = 1; i < 64; ++i) doubling.push_back(Container(0xA0, {i - 1, i - 1}));
  ExpectRefused(Assemble(doubling, 63), "exponential sharing");

  // Sharing itself is fine: one string under many keys is how writers save space.
  std::vector<Bytes> shared{Container(0xA0, {1, 1, 1}), {0x51, 'a'}};
  EXPECT_EQ(ReadBinary(Assemble(shared)), Value(Array{Value("a"), Value("a"), Value("a")}));
}

std::string Plist(std::string_view body) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">" +
         std::string(body) + "</plist>";
}

TEST(PlistMalformed, XmlIsChecked) {
  std::string deep = "<plist>";
  for (int i = 0; i < 10000; ++i) deep += "<array>";
  for (int i = 0; i < 10000; ++i) deep += "</array>";
  deep += "</plist>";
  // Past 16 keys duplicates are found by sorting rather than pair by pair.
  std::string manyKeys = "<dict>";
  for (int i = 0; i < 20; ++i) manyKeys += "<key>k" + std::to_string(i % 19) + "</key><true/>";
  manyKeys += "</dict>";
  const struct {
    const char* what;
    std::string document;
  } cases[] = {
      // Refused at the declaration, so no entity expansion (and no entity bomb) can start.
      {"entity declaration",
       "<!DOCTYPE plist [<!ENTITY a \"lol\">]><plist><string>&a;</string></plist>"},
      {"undefined entity behind an external DTD",
       "<!DOCTYPE plist SYSTEM \"plist.dtd\"><plist><string>&x;</string></plist>"},
      {"10,000-deep nesting", deep},
      {"unknown element", Plist("<null/>")},
      {"element inside a string", Plist("<string>a<b/></string>")},
      {"text inside true", Plist("<true>yes</true>")},
      {"key outside a dictionary", Plist("<array><key>k</key></array>")},
      {"value without a key", Plist("<dict><string>v</string></dict>")},
      {"key without a value", Plist("<dict><key>k</key></dict>")},
      {"duplicate key", Plist("<dict><key>k</key><true/><key>k</key><false/></dict>")},
      {"duplicate key among many", Plist(manyKeys)},
      {"two top-level values", Plist("<true/><false/>")},
      {"empty plist", Plist("")},
      {"root is not plist", "<dict/>"},
      {"not well-formed", Plist("<array>")},
      {"base64 without padding", Plist("<data>AQI</data>")},
      {"base64 padding in the middle", Plist("<data>AQ==AQID</data>")},
      {"integer above 2^64-1", Plist("<integer>18446744073709551616</integer>")},
      {"integer below -2^63", Plist("<integer>-9223372036854775809</integer>")},
      {"real beyond a double", Plist("<real>1e999</real>")},
      {"February 30th", Plist("<date>2014-02-30T00:00:00Z</date>")},
      {"date without time", Plist("<date>2014-04-10</date>")},
  };
  for (const auto& c : cases) ExpectRefused(AsBytes(c.document), c.what);
}

TEST(PlistMalformed, XmlAcceptsWhatOtherWritersProduce) {
  const struct {
    std::string document;
    Value expected;
  } cases[] = {
      {Plist("<integer> -9223372036854775808 </integer>"),
       Value::Int(std::numeric_limits<int64_t>::min())},
      {Plist("<integer>+7</integer>"), Value::Int(7)},
      {Plist("<real>+1E3</real>"), Value::Real(1000)},
      {Plist("<string/>"), Value("")},
      {Plist("<string>&lt;&#x1F600;&amp;</string>"), Value("<\xF0\x9F\x98\x80&")},
  };
  for (const auto& c : cases) {
    std::string error;
    EXPECT_EQ(ReadXml(AsBytes(c.document), &error), c.expected) << c.document << ": " << error;
  }
}

}  // namespace
}  // namespace brisvale::plist
