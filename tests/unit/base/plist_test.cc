// The property-list value type (kinds, equality, dictionary order, descriptions) and
// both formats: documents of values chosen to hit the encodings' edges (integer widths,
// length headers, string encodings, base64 padding, reference widths) read back by us
// and by an independent reader and writer, python3's plistlib.
#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <fstream>
#include <limits>

#include "base/plist.h"
#include "plist_test_util.h"
#include "test_files.h"

namespace brisvale::plist {
namespace {

TEST(PlistValue, DescriptionOfEachKind) {
  const struct {
    Value value;
    const char* text;
  } cases[] = {
      {Value::Int(std::numeric_limits<int64_t>::min()), "-9223372036854775808"},
      {Value::UInt(std::numeric_limits<uint64_t>::max()), "18446744073709551615"},
      {Value::Bool(true), "true"},
      {Value(Bytes{0x0a, 0x1b, 0xff}), "<0a1bff>"},
      {Value(Bytes{}), "<>"},
      {Value::Real(0.5), "0.5"},
      {Value(Date{418863330}), "2014-04-10T22:55:30Z"},
      {Value(Date{-0.5}), "2000-12-31T23:59:59Z"},  // floored, not rounded toward zero
      {Value(Array{}), "[]"},
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
  EXPECT_NE(Value::Int(1), Value::Bool(true));
  EXPECT_NE(Value("ab"), Value(Bytes{'a', 'b'}));
  // An unsigned integer that fits in int64 is the same value as the signed one.
  EXPECT_EQ(Value::UInt(7), Value::Int(7));
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
  EXPECT_EQ(d.size(), 2u);
}

Value Ints() {
  Array a;
  for (int64_t n : {int64_t{0}, int64_t{1}, int64_t{127}, int64_t{128}, int64_t{255},
                    int64_t{256}, int64_t{32767}, int64_t{65535}, int64_t{65536},
                    int64_t{2147483647}, int64_t{4294967295}, int64_t{4294967296},
                    std::numeric_limits<int64_t>::max(), int64_t{-1}, int64_t{-128},
                    int64_t{-129}, int64_t{-32768}, int64_t{-32769}, int64_t{-2147483648},
                    int64_t{-2147483649}, std::numeric_limits<int64_t>::min()}) {
    a.push_back(Value::Int(n));
  }
  a.push_back(Value::UInt(uint64_t{1} << 63));
  a.push_back(Value::UInt(std::numeric_limits<uint64_t>::max()));
  return Value(std::move(a));
}

Value Strings() {
  return Value(Array{Value(""), Value("fourteen chars"), Value("fifteen chars.."),
                     Value(std::string(300, 'x')), Value("h\xC3\xA9llo"),
                     Value("\xF0\x9F\x98\x80 outside the BMP"), Value("<&>\"' ]]>"),
                     Value("tab\tline\n")});
}

Value DataAndNumbers() {
  Bytes big(300);
  for (size_t i = 0; i < big.size(); ++i) big[i] = static_cast<uint8_t>(i * 7);
  return Value(Array{Value(Bytes{}), Value(Bytes{1}), Value(Bytes{1, 2}), Value(Bytes{1, 2, 3}),
                     Value(std::move(big)), Value::Real(0.1), Value::Real(-1e300),
                     Value::Real(5e-324), Value::Real(std::numeric_limits<double>::infinity()),
                     Value::Bool(true), Value::Bool(false), Value(Date{418863330}),
                     Value(Date{-3e9})});
}

Value Containers() {
  Dictionary wide;
  for (int i = 0; i < 20; ++i) wide.set("key" + std::to_string(i), Value("repeated"));
  return Value(Dictionary{
      {"EmptyArray", Value(Array{})},
      {"EmptyDict", Value(Dictionary{})},
      {"Wide", Value(std::move(wide))},
      {"Nested", Value(Array{Value(Array{Value(Dictionary{{"deep", Value(Array{})}})})})},
  });
}

// Past 65,536 objects, references and offsets need four bytes.
Value Large() {
  Array a;
  for (int i = 0; i < 70000; ++i) a.push_back(Value::Int(i % 3 == 0 ? i : -i));
  return Value(std::move(a));
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
  const struct {
    std::string written;
    std::string read;
  } cases[] = {
      {"cr\r", "cr\r"},
      {"a\x01" "b\xFF" "c", "a\xEF\xBF\xBD" "b\xEF\xBF\xBD" "c"},
  };
  for (const auto& c : cases) {
    auto read = ReadXml(AsBytes(WriteXml(Value(c.written))));
    ASSERT_TRUE(read);
    EXPECT_EQ(*read->string(), c.read);
  }
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
  const Value expected(Array{Ints(), Strings(), DataAndNumbers(), Containers(), Large()});
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

}  // namespace
}  // namespace brisvale::plist
