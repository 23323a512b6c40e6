// The Linux mount-table reader: count then fill, decoded paths, the read-only flag.
#include <gtest/gtest.h>
#include <sys/mount.h>

#include <fstream>
#include <string>

#include "platform/linux/os_system.h"
#include "test_files.h"

namespace brisvale::os {
namespace {

TEST(MountTable, CountThenFillDecodesPathsAndReadsTheReadOnlyFlag) {
  const testing::ScratchDir scratch;
  const std::string name = scratch.str() + "/mountinfo";
  std::ofstream(name)
      << "22 1 254:0 / / rw,relatime shared:1 - ext4 /dev/vda rw\n"
         "40 22 0:35 / /private/var/mnt/my\\040stick rw,nosuid - tmpfs tmp\\040fs rw\n"
         "41 22 7:3 / /Developer ro,nodev - ext4 /dev/loop3 ro\n"
         "42 22 7:4 / /private/var/factory_mount rw - erofs /dev/loop4 ro\n"
         "43 22 0:36 / /proc rw - proc none rw\n"
         "44 22 0:37 / /" << std::string(1100, 'd') << " rw - fuse.a-very-long-type-name src rw\n";

  EXPECT_EQ(ReadMountTable(name.c_str(), {}), 6);
  std::vector<MountRecord> records(7);
  ASSERT_EQ(ReadMountTable(name.c_str(), records), 6);
  EXPECT_EQ(records[1], (MountRecord{0, "tmpfs", "/private/var/mnt/my stick", "tmp fs"}));
  EXPECT_EQ(records[2], (MountRecord{kMountReadOnly, "ext4", "/Developer", "/dev/loop3"}));
  // Read-only in the file system's own options counts too.
  EXPECT_EQ(records[3].flags, kMountReadOnly);
  EXPECT_EQ(records[0].flags, 0u);
  // Paths are cut to 1023 bytes and type names to 15, as fixed-size fields hold them.
  EXPECT_EQ(records[5].mountedOn, "/" + std::string(1022, 'd'));
  EXPECT_EQ(records[5].typeName, "fuse.a-very-lon");

  // A buffer smaller than the table takes the first records only.
  std::vector<MountRecord> two(2);
  EXPECT_EQ(ReadMountTable(name.c_str(), two), 2);
  EXPECT_EQ(two[1].mountedOn, "/private/var/mnt/my stick");
  EXPECT_LT(ReadMountTable((scratch.str() + "/missing").c_str(), {}), 0);
}

// The fill reuses the count's table only while the kernel reports no change.
TEST(MountTable, FillSeesAMountMadeAfterTheCount) {
  BRISVALE_REQUIRE_ROOT();
  const testing::ScratchDir scratch;
  const std::string dir = scratch.str();
  LinuxOs os;
  const int counted = os.GetMountTable({});
  ASSERT_GT(counted, 0);
  ASSERT_EQ(mount("tmpfs", dir.c_str(), "tmpfs", 0, nullptr), 0);
  std::vector<MountRecord> records(counted + 1);
  const int filled = os.GetMountTable(records);
  umount2(dir.c_str(), MNT_DETACH);
  ASSERT_EQ(filled, counted + 1);
  EXPECT_EQ(records[filled - 1].mountedOn, dir);
}

}  // namespace
}  // namespace brisvale::os
