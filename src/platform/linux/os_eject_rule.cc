// Whether ejecting a block device would pull a disk out from under a mounted partition.
// The eject request reaches the whole disk even when sent to one of its partitions, so a
// stick with two mounted partitions must not be ejected when the first one is unmounted:
// a disk is ejected only once none of its partitions is mounted.
#include <sys/sysmacros.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>
#include <string>

#include "platform/linux/os_system.h"

namespace brisvale::os {
namespace {

namespace fs = std::filesystem;

std::string DeviceNumberText(dev_t device) {
  return std::to_string(major(device)) + ":" + std::to_string(minor(device));
}

// "major:minor" of every mounted file system this process can see.
std::set<std::string> MountedDeviceNumbers(const std::string& mountInfoPath) {
  std::set<std::string> mounted;
  std::ifstream table(mountInfoPath);
  std::string line;
  while (std::getline(table, line)) {
    std::istringstream fields(line);
    std::string id, parent, device;
    if (fields >> id >> parent >> device) mounted.insert(device);
  }
  return mounted;
}

}  // namespace

bool DiskHasMountedPartition(dev_t device, const std::string& sysRoot, const std::string& mountInfoPath) {
  std::error_code error;
  fs::path node = fs::canonical(sysRoot + "/dev/block/" + DeviceNumberText(device), error);
  if (error) return false;
  // A partition's sysfs directory sits inside its disk's.
  const fs::path disk = fs::exists(node / "partition", error) ? node.parent_path() : node;
  const std::set<std::string> mounted = MountedDeviceNumbers(mountInfoPath);
  for (const fs::directory_entry& entry : fs::directory_iterator(disk, error)) {
    if (!fs::exists(entry.path() / "partition", error)) continue;
    std::ifstream numberFile(entry.path() / "dev");
    std::string number;
    if (numberFile >> number && mounted.count(number)) return true;
  }
  return false;
}

}  // namespace brisvale::os
