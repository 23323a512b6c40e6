// Whether ejecting a block device would pull a disk out from under a mounted partition.
// The eject request reaches the whole disk even when sent to one of its partitions, so a
// stick with two mounted partitions must not be ejected when the first one is unmounted:
// a disk is ejected only once none of its partitions is mounted.
#include <sys/sysmacros.h>

#include <filesystem>
#include <fstream>
#include <set>
#include <string>

#include "platform/linux/os_system.h"

namespace brisvale::os {
namespace {

namespace fs = std::filesystem;

std::string DeviceNumberText(dev_t device) {
  return std::to_string(major(device)) + ":" + std::to_string(minor(device));
}

}  // namespace

dev_t ReadDeviceNumberFile(const std::string& path) {
  unsigned int majorNumber = 0, minorNumber = 0;
  std::ifstream numberFile(path);
  char colon = 0;
  if (!(numberFile >> majorNumber >> colon >> minorNumber) || colon != ':') return 0;
  return makedev(majorNumber, minorNumber);
}

bool DiskHasMountedPartition(dev_t device, const std::string& sysRoot, const std::string& mountInfoPath) {
  std::error_code error;
  fs::path node = fs::canonical(sysRoot + "/dev/block/" + DeviceNumberText(device), error);
  if (error) return false;
  // A partition's sysfs directory sits inside its disk's.
  const fs::path disk = fs::exists(node / "partition", error) ? node.parent_path() : node;
  std::set<dev_t> mounted;
  if (ReadMountedDevices(mountInfoPath.c_str(), mounted) < 0) return false;
  for (fs::directory_iterator entry(disk, error), end; !error && entry != end; entry.increment(error)) {
    std::error_code ignored;
    if (fs::exists(entry->path() / "partition", ignored) && mounted.count(ReadDeviceNumberFile(entry->path() / "dev"))) return true;
  }
  return false;
}

}  // namespace brisvale::os
