// The Linux implementation of the core's operating-system interface. Each group of
// calls is implemented in its own os_*.cc file.
#pragma once

#include <sys/types.h>

#include <set>
#include <span>
#include <string>
#include <vector>

#include "base/unique_fd.h"
#include "platform/os.h"

namespace brisvale::os {

class LinuxOs final : public Os {
 public:
  // os_mounts.cc
  int GetMountTable(std::span<MountRecord> records) override;
  // os_volume_header.cc
  VolumeHeaderRead ReadVolumeHeader(const char* devicePath, VolumeHeaderSpan header) override;
  // os_unmount.cc
  int Unmount(const char* path, bool force) override;
  int RemoveDirectory(const char* path) override;
  int Unlink(const char* path) override;
  int SyncFilesystem(const char* path) override;
  int OpenDevice(const char* devicePath) override;
  int EjectDevice(int fd) override;
  int MountedDevice(const char* path, uint64_t& device) override;
  int DeviceNumber(int fd, uint64_t& device) override;
  // os_tree.cc
  DirectoryListing ReadDirectory(const char* path) override;
  int RealPath(const char* path, std::string& resolved) override;
  int ClearFlags(const char* path) override;
  TreeWalk WalkTree(const char* root, const std::function<bool(const TreeNode&)>& visit) override;
  // os_image_file.cc
  int StatPath(const char* path, FileStatus& status) override;
  int StatDescriptor(int fd, FileStatus& status) override;
  int MakeDirectory(const char* path, uint32_t mode) override;
  int MakeTemporaryDirectory(std::string& pathTemplate) override;
  int ChangeMode(const char* path, uint32_t mode) override;
  int OpenImageFile(const char* path) override;
  int TakeReadLease(int fd) override;
  bool HoldsReadLease(int fd) override;
  // os_spawn.cc
  int SpawnProgram(const std::vector<std::string>& argv) override;
  int WaitForChild(int pid, int& waitStatus) override;
  // os_mount_volume.cc
  int MountVolume(const char* type, const char* mountPoint, uint32_t flags,
                  const VolumeMountArguments& arguments) override;
  int EncodingBias(const char* type, int32_t& bias) override;
  // os_files.cc
  int UserHomeDirectory(uint32_t uid, std::string& home) override;
  int ReadFile(const char* path, size_t maxLength, std::vector<uint8_t>& contents) override;
  int OpenFile(const char* path) override;
  int FileSize(int fd, uint64_t& size) override;
  int64_t Read(int fd, std::span<uint8_t> buffer, uint64_t offset) override;
  int MapFile(int fd, size_t length, std::unique_ptr<FileMapping>& mapping) override;
  // os_files_below.cc
  int ReadFilesBelow(const char* directory, size_t maxFileBytes,
                     const std::function<bool(const FoundFile&)>& visit) override;
  int UnlinkAt(int directory, const char* name) override;
  int RemoveDirectoryAt(int directory, const char* name) override;
  int ClearFlagsAt(int directory, const char* name) override;

 private:
  UniqueFd mountInfo_;               // /proc/self/mountinfo, opened on first use
  std::vector<MountRecord> table_;   // the last table parsed
  bool countedTable_ = false;        // table_ was parsed for a count
};

// True when `device`, or the disk it is a partition of, has a partition that is still
// mounted (os_eject_rule.cc). Tests point the two paths at a tree of their own.
bool DiskHasMountedPartition(dev_t device, const std::string& sysRoot = "/sys",
                             const std::string& mountInfoPath = "/proc/self/mountinfo");

// Opens the directory `path` for reading, refusing a symbolic link at any step on the
// way (os_tree.cc); -errno on failure. `byComponents` skips the single-call form, for tests.
int OpenDirectoryNoLinks(const char* path, bool byComponents = false);

// The device number a sysfs "dev" file holds as "major:minor"; 0 when unreadable.
dev_t ReadDeviceNumberFile(const std::string& path);

// GetMountTable over a table in the kernel's mountinfo format at `path`.
int ReadMountTable(const char* path, std::span<MountRecord> records);
// The whole table at `path`, fields uncut (for the sandbox, which must name every
// mount exactly); its size or -errno.
int ReadWholeMountTable(const char* path, std::vector<MountRecord>& records);
// The device numbers of the file systems in the table at `path`; their count or -errno.
int ReadMountedDevices(const char* path, std::set<dev_t>& devices);

}  // namespace brisvale::os
