// The property-list value type (kinds, equality, dictionary order, descriptions) and
// both formats: documents of values chosen to hit the encodings' edges (integer widths,
// length headers, string encodings, base64 padding, reference widths) read back by us
// and by an independent reader and writer, python3's plistlib; and the readers against
// hostile documents, each of which must be refused with an error text, quickly. Binary
// documents are assembled object by object so each case says exactly which structure
// is broken.
#include <gtest/gtest.h>

#include <chrono>
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <fstream>
#include <limits>
#include <span>
#include <string_view>

#include "base/plist.h"
#include "test_files.h"

namespace brisvale::plist {
namespace {

std::span<const uint8_t> AsBytes(std::string_view text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

TEST(PlistValue, DescriptionOfEachKind) {
  const struct {
    Value value;
    const char* text;
  } cases[] = {
      {Value::Int(std::numeric_limits<int64_t>::min()), "-9223372036854775808"},
      {Value::UInt(std::numeric_limits<uint64_t>::max()), "18446744073709551615"},
      {Value::Bool(true), "true"},
      {Value(Bytes{0x0a, 0x1b, 0xff}), "<0a1bff>"},
      {Value::Real(0.5), "0.5"},
      {Value(Date{418863330}), "2014-04-10T22:55:30Z"},
      {Value(Date{-0.5}), "2000-12-31T23:59:59Z"},  // floored, not rounded toward zero
      {Value(Array{Value("a"), Value::Int(1)}), "[a, 1]"},
      {Value(Dictionary{{"Key", Value("value")}, {"Key2", Value(Array{Value::Bool(true)})}}),
       "{Key: value, Key2: [true]}"},
      {Value(), "{}"},
  };
  for (const auto& c : cases) EXPECT_EQ(c.value.description(), c.text);
}

TEST(PlistValue, EqualityIsByValue) {
  const Value ab(Dictionary{{"a", Value::Int(1)}, {"b", Value("2")}});
  const Value ba(Dictionary{{"b", Value("2")}, {"a", Value::Int(1)}});
  EXPECT_EQ(ab, ba);
  EXPECT_NE(ab, Value(Dictionary{{"a", Value::Int(1)}, {"c", Value("2")}}));
  EXPECT_NE(ab, Value(Dictionary{{"a", Value::Int(1)}}));
  // Same numbers in different kinds are different values.
  EXPECT_NE(Value::Int(1), Value::Real(1));
  // An unsigned integer that fits in int64 is the same value as the signed one.
  EXPECT_EQ(Value(Integer{7, true}), Value::Int(7));
}

TEST(PlistValue, DictionaryKeepsOrderAndReplacesInPlace) {
  Dictionary d{{"z", Value::Int(1)}, {"a", Value::Int(2)}};
  d.set("z", Value::Int(3));
  d.set("m", Value::Int(4));
  std::string order;
  for (const auto& [key, value] : d) order += key + value.description();
  EXPECT_EQ(order, "z3a2m4");
  EXPECT_TRUE(d.erase("a"));
  EXPECT_FALSE(d.erase("a"));
}

// One document at the formats' edges: integer widths, count headers (14 and 15),
// string encodings, base64 padding, shared strings, and past 65,536 objects four-byte
// references and offsets.
Value EdgeDocument() {
  Array ints;
  for (int64_t n : std::initializer_list<int64_t>{0, 1, 127, 128, 255, 256, 32767, 65535, 65536, 2147483647,
                                                  4294967295, 4294967296, std::numeric_limits<int64_t>::max(), -1,
                                                  -128, -129, -32768, -32769, -2147483648, -2147483649,
                                                  std::numeric_limits<int64_t>::min()}) {
    ints.push_back(Value::Int(n));
  }
  ints.push_back(Value::UInt(uint64_t{1} << 63));
  ints.push_back(Value::UInt(std::numeric_limits<uint64_t>::max()));
  Bytes big(300);
  for (size_t i = 0; i < big.size(); ++i) big[i] = static_cast<uint8_t>(i * 7);
  Dictionary wide;
  for (int i = 0; i < 20; ++i) wide.set("key" + std::to_string(i), Value("repeated"));
  Array large;
  for (int i = 0; i < 70000; ++i) large.push_back(Value::Int(i % 3 == 0 ? i : -i));
  return Value(Array{
      Value(std::move(ints)),
      Value(Array{Value(""), Value("fourteen chars"), Value("fifteen chars.."), Value(std::string(300, 'x')),
                  Value("h\xC3\xA9llo"), Value("\xF0\x9F\x98\x80 outside the BMP"), Value("<&>\"' ]]>"),
                  Value("tab\tline\n")}),
      Value(Array{Value(Bytes{}), Value(Bytes{1}), Value(Bytes{1, 2}), Value(Bytes{1, 2, 3}), Value(std::move(big)),
                  Value::Real(0.1), Value::Real(-1e300), Value::Real(5e-324),
                  Value::Real(std::numeric_limits<double>::infinity()), Value::Bool(true), Value::Bool(false),
                  Value(Date{418863330}), Value(Date{-3e9})}),
      Value(Dictionary{
          {"EmptyArray", Value(Array{})},
          {"EmptyDict", Value(Dictionary{})},
          {"Wide", Value(std::move(wide))},
          {"Nested", Value(Array{Value(Array{Value(Dictionary{{"deep", Value(Array{})}})})})},
      }),
      Value(std::move(large)),
  });
}

// What equality cannot check: a date's fraction of a second, kept in binary and dropped
// in XML, and NaN, which equals nothing.
TEST(PlistCodec, DateFractionsAndNotANumber) {
  const Value date(Date{418863330.75});
  EXPECT_EQ(ReadBinary(WriteBinary(date)), date);
  EXPECT_EQ(ReadXml(AsBytes(WriteXml(date))), Value(Date{418863330}));
  const Value nan = Value::Real(std::numeric_limits<double>::quiet_NaN());
  for (const std::optional<Value>& read : {ReadBinary(WriteBinary(nan)), ReadXml(AsBytes(WriteXml(nan)))}) {
    ASSERT_TRUE(read && read->real());
    EXPECT_TRUE(std::isnan(*read->real()));
  }
}

// A literal CR would come back as LF after the parser's line-end handling; control
// characters and broken UTF-8 would make a document no reader accepts, so they become
// U+FFFD.
TEST(PlistCodec, XmlWriterKeepsTheDocumentReadable) {
  EXPECT_EQ(ReadXml(AsBytes(WriteXml(Value("cr\r")))), Value("cr\r"));
  EXPECT_EQ(ReadXml(AsBytes(WriteXml(Value("a\x01" "b\xFF" "c")))), Value("a\xEF\xBF\xBD" "b\xEF\xBF\xBD" "c"));
}

// plistlib, an independent reader and writer, must read our two documents as the same
// value and write each back in the other format for us to read.
constexpr const char kScript[] = R"PY(
import plistlib, sys
d = sys.argv[1]
with open(f"{d}/ours.bplist", "rb") as f:
    binary = plistlib.load(f, fmt=plistlib.FMT_BINARY)
with open(f"{d}/ours.xml", "rb") as f:
    xml = plistlib.load(f, fmt=plistlib.FMT_XML)
if binary != xml:
    sys.exit("plistlib reads our two documents differently")
with open(f"{d}/theirs.xml", "wb") as f:
    plistlib.dump(binary, f, fmt=plistlib.FMT_XML)
with open(f"{d}/theirs.bplist", "wb") as f:
    plistlib.dump(xml, f, fmt=plistlib.FMT_BINARY)
)PY";

// Where python3 with plistlib is missing, only our own documents are read back.
TEST(PlistCodec, BothFormatsReadBackAndPython3PlistlibAgrees) {
  const brisvale::testing::ScratchDir dir;
  const Value expected = EdgeDocument();
  brisvale::testing::WriteFileBytes(dir / "ours.bplist", WriteBinary(expected));
  const std::string xml = WriteXml(expected);
  brisvale::testing::WriteFileBytes(dir / "ours.xml", Bytes(xml.begin(), xml.end()));
  std::vector<std::string> names{"ours.bplist", "ours.xml"};
  if (std::system("python3 -c 'import plistlib' >/dev/null 2>&1") == 0) {
    std::ofstream(dir / "check.py") << kScript;
    const std::string command = "python3 " + (dir / "check.py").string() + " " + dir.str();
    EXPECT_EQ(std::system(command.c_str()), 0) << "plistlib could not read what we wrote";
    names.insert(names.end(), {"theirs.bplist", "theirs.xml"});
  }
  for (const std::string& name : names) {
    std::string error;
    Format format;
    EXPECT_EQ(Read(brisvale::testing::ReadFileBytes(dir / name), &error, &format), expected) << name << ": " << error;
    EXPECT_EQ(format, name.ends_with(".xml") ? Format::Xml : Format::Binary) << name;
  }
}

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
  EXPECT_EQ(ReadXml(AsBytes(Plist("<integer> -9223372036854775808 </integer>"))),
            Value::Int(std::numeric_limits<int64_t>::min()));
  EXPECT_EQ(ReadXml(AsBytes(Plist("<integer>+7</integer>"))), Value::Int(7));
  EXPECT_EQ(ReadXml(AsBytes(Plist("<real>+1E3</real>"))), Value::Real(1000));
  EXPECT_EQ(ReadXml(AsBytes(Plist("<string>&lt;&#x1F600;&amp;</string>"))), Value("<\xF0\x9F\x98\x80&"));
}

}  // namespace
}  // namespace brisvale::plist
