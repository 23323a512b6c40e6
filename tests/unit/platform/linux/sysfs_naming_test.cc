// Names the sysfs provider derives: partition-table content strings and USB location IDs.
#include <gtest/gtest.h>

#include "platform/linux/format_attach_request.h"
#include "platform/linux/registry_sysfs.h"

namespace brisvale::registry::sysfs {
namespace {

TEST(UsbLocationId, BusInTheTopByteThenOneNibblePerPort) {
  struct Case {
    const char* name;
    std::optional<uint32_t> expected;
  };
  const Case cases[] = {
      {"1-0:1.0", 0x01000000},           // root hub interface
      {"2-1.4", 0x02140000},
      {"3-1.2.3.4.5.6", 0x03123456},     // six tiers fill the nibbles
      {"3-1.2.3.4.5.6.7", 0x03123456},   // a seventh does not spill over
      {"1-20", 0x01f00000},              // above 15: saturated
      {"255-1", 0xff100000},
      {"256-1", std::nullopt},
      {"usb1", std::nullopt},
      {"1-", std::nullopt},
      {"1-0.1", std::nullopt},
  };
  for (const auto& c : cases) EXPECT_EQ(UsbLocationId(c.name), c.expected) << c.name;
}

TEST(MediaContent, GuidsUpperCaseMbrTypesInHexSchemesByName) {
  EXPECT_EQ(PartitionContent("c12a7328-f81f-11d2-ba4b-00a0c93ec93b", 0),
            "C12A7328-F81F-11D2-BA4B-00A0C93EC93B");
  EXPECT_EQ(PartitionContent(nullptr, 0x0c), "0x0C");
  EXPECT_EQ(PartitionContent("", 0x83), "0x83");
  EXPECT_EQ(SchemeContent("gpt"), "GPT_partition_scheme");
  EXPECT_EQ(SchemeContent("dos"), "MBR_partition_scheme");
  EXPECT_EQ(SchemeContent(""), "");
  EXPECT_TRUE(formats::IsUuidText("0F8E6A42-1B2C-4D3E-8F90-A1B2C3D4E5F6"));
  EXPECT_FALSE(formats::IsUuidText("0F8E6A42-1B2C-4D3E-8F90-A1B2C3D4E5F"));
  EXPECT_FALSE(formats::IsUuidText("0F8E6A42x1B2C-4D3E-8F90-A1B2C3D4E5F6"));
}

}  // namespace
}  // namespace brisvale::registry::sysfs
