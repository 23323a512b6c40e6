// Round trips through both formats, over values chosen to hit the encodings' edges:
// integer widths, length headers, string encodings, base64 padding, reference widths.
#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>

#include "base/plist.h"
#include "plist_test_util.h"

namespace brisvale::plist {
namespace {

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
                     Value("tab\tline\ncr\r")});
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
  Array long_array;
  for (int i = 0; i < 20; ++i) {
    wide.set("key" + std::to_string(i), Value("repeated"));
    long_array.push_back(Value::Int(i));
  }
  return Value(Dictionary{
      {"EmptyArray", Value(Array{})},
      {"EmptyDict", Value(Dictionary{})},
      {"Wide", Value(std::move(wide))},
      {"Long", Value(std::move(long_array))},
      {"Nested", Value(Array{Value(Array{Value(Dictionary{{"deep", Value(Array{})}})})})},
  });
}

// Past 65,536 objects, references and offsets need four bytes.
Value Large() {
  Array a;
  for (int i = 0; i < 70000; ++i) a.push_back(Value::Int(i % 3 == 0 ? i : -i));
  return Value(std::move(a));
}

TEST(PlistCodec, RoundTripsThroughBothFormats) {
  const Value values[] = {Ints(), Strings(), DataAndNumbers(), Containers(), Large(),
                          Value("top-level string"), Value::Int(5), Value(Array{})};
  for (const Value& value : values) {
    SCOPED_TRACE(value.description().substr(0, 200));
    std::string error;
    const Bytes binary = WriteBinary(value);
    EXPECT_EQ(ReadBinary(binary, &error), value) << error;
    const std::string xml = WriteXml(value);
    const std::span<const uint8_t> xmlBytes = AsBytes(xml);
    EXPECT_EQ(ReadXml(xmlBytes, &error), value) << error;

    Format format;
    EXPECT_EQ(Read(binary, nullptr, &format), value);
    EXPECT_EQ(format, Format::Binary);
    EXPECT_EQ(Read(xmlBytes, nullptr, &format), value);
    EXPECT_EQ(format, Format::Xml);
  }
}

TEST(PlistCodec, DatesKeepFractionsInBinaryAndWholeSecondsInXml) {
  const Value date(Date{418863330.75});
  EXPECT_EQ(ReadBinary(WriteBinary(date)), date);
  const std::string xml = WriteXml(date);
  EXPECT_NE(xml.find("<date>2014-04-10T22:55:30Z</date>"), std::string::npos);
  auto read = ReadXml(AsBytes(xml));
  ASSERT_TRUE(read);
  EXPECT_EQ(read->date()->secondsSinceReferenceDate, 418863330);
}

TEST(PlistCodec, NotANumberSurvivesAsNotANumber) {
  const Value nan = Value::Real(std::numeric_limits<double>::quiet_NaN());
  const std::string xml = WriteXml(nan);
  for (const std::optional<Value>& read :
       {ReadBinary(WriteBinary(nan)),
        ReadXml(AsBytes(xml))}) {
    ASSERT_TRUE(read && read->real());
    EXPECT_TRUE(std::isnan(*read->real()));
  }
}

TEST(PlistCodec, XmlWriterKeepsTheDocumentReadable) {
  // Characters XML 1.0 cannot carry and broken UTF-8 become U+FFFD instead of
  // producing a document no reader accepts.
  const std::string xml = WriteXml(Value(std::string("a\x01" "b\xFF" "c")));
  auto read = ReadXml(AsBytes(xml));
  ASSERT_TRUE(read);
  EXPECT_EQ(*read->string(), "a\xEF\xBF\xBD" "b\xEF\xBF\xBD" "c");
}

TEST(PlistCodec, BinaryWriterSharesEqualStrings) {
  Array entries;
  for (int i = 0; i < 100; ++i) {
    entries.push_back(Value(Dictionary{{"DeviceType", Value("DiskImage")}}));
  }
  // The array, 100 dictionaries, one key and one value.
  const Bytes binary = WriteBinary(Value(std::move(entries)));
  EXPECT_EQ(binary[binary.size() - 17], 103);
}

}  // namespace
}  // namespace brisvale::plist
