// An operating system for unit tests: a mount table and volume headers set by the test,
// every other call answering ENOSYS unless the test overrides it.
#pragma once

#include <cerrno>
#include <map>
#include <string>
#include <vector>

#include "platform/os.h"

namespace brisvale::testing {

class FakeOs : public os::Os {
 public:
  std::vector<os::MountRecord> mounts;
  // Volume headers by device path; a path not listed fails to open with ENOENT.
  std::map<std::string, std::vector<uint8_t>, std::less<>> volumeHeaders;

  int GetMountTable(std::span<os::MountRecord> records) override {
    if (records.empty()) return static_cast<int>(mounts.size());
    const size_t count = std::min(records.size(), mounts.size());
    std::copy_n(mounts.begin(), count, records.begin());
    return static_cast<int>(count);
  }
  os::VolumeHeaderRead ReadVolumeHeader(const char* devicePath, os::VolumeHeaderSpan header) override {
    const auto found = volumeHeaders.find(devicePath);
    if (found == volumeHeaders.end()) return {os::VolumeHeaderRead::Outcome::OpenFailed, ENOENT};
    std::fill(header.begin(), header.end(), 0);
    std::copy_n(found->second.begin(), std::min(found->second.size(), header.size()), header.begin());
    return {};
  }
  int Unmount(const char*, bool) override { return -ENOSYS; }
  int RemoveDirectory(const char*) override { return -ENOSYS; }
  int Unlink(const char*) override { return -ENOSYS; }
  int SyncFilesystem(const char*) override { return -ENOSYS; }
  int OpenDevice(const char*) override { return -ENOSYS; }
  int EjectDevice(int) override { return -ENOSYS; }
  // Every mount is held by device 1 and every node is device 1 unless a test says else.
  int MountedDevice(const char*, uint64_t& device) override {
    device = 1;
    return 0;
  }
  int DeviceNumber(int, uint64_t& device) override {
    device = 1;
    return 0;
  }
  os::DirectoryListing ReadDirectory(const char*) override { return {-ENOSYS, 0, {}}; }
  int RealPath(const char*, std::string&) override { return -ENOSYS; }
  int ClearFlags(const char*) override { return -ENOSYS; }
  os::TreeWalk WalkTree(const char*, const std::function<bool(const os::TreeNode&)>&) override {
    return {-ENOSYS, 0};
  }
  int MountVolume(const char*, const char*, uint32_t, const os::VolumeMountArguments&) override {
    return -ENOSYS;
  }
  int EncodingBias(const char*, int32_t&) override { return -ENOSYS; }
  int UserHomeDirectory(uint32_t, std::string&) override { return -ENOSYS; }
  int ReadFile(const char*, size_t, std::vector<uint8_t>&) override { return -ENOSYS; }
  int OpenFile(const char*) override { return -ENOSYS; }
  int FileSize(int, uint64_t&) override { return -ENOSYS; }
  int64_t Read(int, std::span<uint8_t>, uint64_t) override { return -ENOSYS; }
  int MapFile(int, size_t, std::unique_ptr<os::FileMapping>&) override { return -ENOSYS; }
  int UnlinkAt(int, const char*) override { return -ENOSYS; }
  int RemoveDirectoryAt(int, const char*) override { return -ENOSYS; }
  int ClearFlagsAt(int, const char*) override { return -ENOSYS; }
};

}  // namespace brisvale::testing
