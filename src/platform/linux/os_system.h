// The Linux implementation of the core's operating-system interface. Each group of
// calls is implemented in its own os_*.cc file.
#pragma once

#include <span>
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
  // os_tree.cc
  int ReadDirectory(const char* path, std::vector<DirectoryEntry>& entries) override;
  int RealPath(const char* path, std::string& resolved) override;
  int ClearFlags(const char* path) override;
  TreeWalk WalkTree(const char* root, const std::function<bool(const TreeNode&)>& visit) override;
  // os_files.cc
  int OpenFile(const char* path) override;
  int64_t FileSize(int fd) override;
  int64_t Read(int fd, std::span<uint8_t> buffer) override;

 private:
  UniqueFd mountInfo_;               // /proc/self/mountinfo, opened on first use
  std::vector<MountRecord> table_;   // the last table parsed
  bool countedTable_ = false;        // table_ was parsed for a count
};

// GetMountTable over a table in the kernel's mountinfo format at `path`.
int ReadMountTable(const char* path, std::span<MountRecord> records);

}  // namespace brisvale::os
