// The disk-image controller's attach record and attach list: which inputs are taken,
// and that nothing out of range gets through.
#include <gtest/gtest.h>

#include <cstring>

#include "base/plist.h"
#include "platform/linux/format_attach_request.h"

namespace brisvale::formats {
namespace {

std::vector<uint8_t> Record(uint32_t magic, uint32_t version, uint64_t address, uint64_t length,
                            uint8_t reservedByte = 0) {
  std::vector<uint8_t> record(kAttachRecordSize);
  std::memcpy(record.data(), &magic, 4);
  std::memcpy(record.data() + 4, &version, 4);
  std::memcpy(record.data() + 8, &address, 8);
  std::memcpy(record.data() + 16, &length, 8);
  record[255] = reservedByte;
  return record;
}

TEST(AttachRecordTest, OnlyAWellFormedRecordIsRead) {
  const auto ok = ParseAttachRecord(Record(kAttachRecordMagic, 1, 0x7f0000001000, 300), nullptr);
  ASSERT_TRUE(ok);
  EXPECT_EQ(ok->address, 0x7f0000001000u);
  EXPECT_EQ(ok->length, 300u);
  struct Case {
    std::vector<uint8_t> record;
    const char* error;
  } refused[] = {
      {std::vector<uint8_t>(255), "record is not 256 bytes"},
      {Record(0xFEEDBEEF, 1, 0x1000, 300), "bad magic"},
      {Record(kAttachRecordMagic, 2, 0x1000, 300), "unknown version"},
      {Record(kAttachRecordMagic, 1, 0, 300), "no property list"},
      {Record(kAttachRecordMagic, 1, 0x1000, 0), "property list length out of range"},
      {Record(kAttachRecordMagic, 1, 0x1000, kMaxAttachListLength + 1), "property list length out of range"},
      {Record(kAttachRecordMagic, 1, UINT64_MAX - 10, 300), "address wraps"},
      {Record(kAttachRecordMagic, 1, 0x1000, 300, 1), "reserved bytes set"},
  };
  for (const Case& c : refused) {
    std::string error;
    EXPECT_FALSE(ParseAttachRecord(c.record, &error));
    EXPECT_EQ(error, c.error);
  }
}

std::vector<uint8_t> List(plist::Dictionary entries) {
  const std::string xml = plist::WriteXml(plist::Value(std::move(entries)));
  return {xml.begin(), xml.end()};
}

plist::Value PathData(std::string_view path) { return plist::Value(plist::Bytes(path.begin(), path.end())); }

TEST(AttachListTest, IdentifierPathAndVerifiedFile) {
  constexpr const char* kId = "0F3C2B1A-9D8E-4F7A-B6C5-D4E3F2A1B0C9";
  const auto request = ParseAttachList(List({{"nimbrel-unique-identifier", plist::Value(kId)},
                                             {"image-path", PathData("/var/images/a.dmg")},
                                             {"image-device", plist::Value::Int(2049)},
                                             {"image-inode", plist::Value::Int(77)}}),
                                       nullptr);
  ASSERT_TRUE(request);
  EXPECT_EQ(request->identifier, kId);
  EXPECT_EQ(request->imagePath, "/var/images/a.dmg");
  ASSERT_TRUE(request->verifiedFile);
  EXPECT_EQ(request->verifiedFile->device, 2049u);
  EXPECT_EQ(request->verifiedFile->inode, 77u);

  const std::string binary = "bplist00";
  struct Case {
    std::vector<uint8_t> list;
    const char* error;
  } refused[] = {
      {{binary.begin(), binary.end()}, "not an XML dictionary"},
      {List({{"image-path", PathData("/a")}}), "bad identifier"},
      {List({{"nimbrel-unique-identifier", plist::Value("not-a-uuid")}, {"image-path", PathData("/a")}}),
       "bad identifier"},
      {List({{"nimbrel-unique-identifier", plist::Value(kId)}, {"image-path", plist::Value("/a")}}),
       "bad image path"},
      {List({{"nimbrel-unique-identifier", plist::Value(kId)}, {"image-path", PathData("a.dmg")}}),
       "bad image path"},
      {List({{"nimbrel-unique-identifier", plist::Value(kId)}, {"image-path", PathData(std::string("/a\0b", 4))}}),
       "bad image path"},
      {List({{"nimbrel-unique-identifier", plist::Value(kId)}, {"image-path", PathData("/" + std::string(1023, 'a'))}}),
       "bad image path"},
      {List({{"nimbrel-unique-identifier", plist::Value(kId)}, {"image-path", PathData("/a")},
             {"image-inode", plist::Value::Int(77)}}),
       "bad verified file identity"},
  };
  for (const Case& c : refused) {
    std::string error;
    EXPECT_FALSE(ParseAttachList(c.list, &error));
    EXPECT_EQ(error, c.error);
  }
}

}  // namespace
}  // namespace brisvale::formats
