// The eject rule over a made-up sysfs: a stick with two partitions is ejected only once
// neither is mounted, whichever node the eject names.
#include <gtest/gtest.h>
#include <sys/sysmacros.h>

#include <filesystem>
#include <fstream>

#include "platform/linux/os_system.h"
#include "test_files.h"

namespace brisvale::os {
namespace {

namespace fs = std::filesystem;

TEST(EjectRuleTest, MadeUpPartitionLayout) {
  const brisvale::testing::ScratchDir root;
  const fs::path disk = root / "devices/usb/block/sdb";
  for (const char* name : {"sdb1", "sdb2"}) fs::create_directories(disk / name);
  std::ofstream(disk / "sdb1/partition") << 1;
  std::ofstream(disk / "sdb1/dev") << "8:17";
  std::ofstream(disk / "sdb2/partition") << 2;
  std::ofstream(disk / "sdb2/dev") << "8:18";
  fs::create_directories(root / "dev/block");
  fs::create_directory_symlink(disk, root / "dev/block/8:16");
  fs::create_directory_symlink(disk / "sdb1", root / "dev/block/8:17");
  fs::create_directory_symlink(disk / "sdb2", root / "dev/block/8:18");

  struct Case { const char* mountedDevice; dev_t ejected; bool refused; };
  for (const Case& c : {Case{"8:18", makedev(8, 17), true}, Case{"8:18", makedev(8, 16), true},
                        Case{"254:0", makedev(8, 17), false}, Case{"8:18", makedev(7, 3), false}}) {
    std::ofstream(root / "mountinfo") << "21 1 254:0 / / rw - ext4 /dev/vda rw\n"
                                      << "40 21 " << c.mountedDevice << " / /mnt rw - hfsplus x rw\n";
    EXPECT_EQ(DiskHasMountedPartition(c.ejected, root.str(), (root / "mountinfo").string()), c.refused)
        << c.mountedDevice << " " << major(c.ejected) << ":" << minor(c.ejected);
  }
}

}  // namespace
}  // namespace brisvale::os
