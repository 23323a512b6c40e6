// The fake system every disk-image unit test runs on: an operating system whose files
// are a table the test fills, recording every call that changes something, installed
// with a registry and a log capture as the current services.
#pragma once

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <map>
#include <string>
#include <vector>

#include "base/log.h"
#include "fake_os.h"
#include "media_records.h"
#include "platform/services.h"
#include "qor4_test_support.h"
#include "registry/registry_model.h"

namespace brisvale::testing {

inline constexpr uint32_t kDirectory = 0040755, kFile = 0100644, kLink = 0120777;

class FileTreeOs : public FakeOs {
 public:
  std::map<std::string, os::FileStatus, std::less<>> files;
  std::map<std::string, std::string, std::less<>> contents;   // what ReadFile finds
  std::map<std::string, int, std::less<>> mkdirErrors;        // -errno by path
  std::map<std::string, std::string, std::less<>> realPaths;  // when not the path itself
  std::vector<std::string> calls;
  int temporaryCount = 0;
  std::optional<os::FileStatus> openedStatus;  // what fstat says of the opened image
  int leaseResult = 0;
  bool leaseHeld = true;
  int mountResult = 0;
  uint32_t mountFlags = 0;
  os::VolumeMountArguments mountArguments;

  void AddFile(const std::string& path, uint32_t mode) { files[path] = os::FileStatus{mode, 7, 1, 1}; }

  int StatPath(const char* path, os::FileStatus& status) override {
    const auto found = files.find(path);
    if (found == files.end()) return -ENOENT;
    status = found->second;
    return 0;
  }
  int StatDescriptor(int, os::FileStatus& status) override {
    status = openedStatus.value_or(os::FileStatus{kFile, 7, 1, 1});
    return 0;
  }
  int MakeDirectory(const char* path, uint32_t mode) override {
    calls.push_back("mkdir " + std::string(path));
    if (const auto error = mkdirErrors.find(path); error != mkdirErrors.end()) return error->second;
    return files.emplace(path, os::FileStatus{0040000 | mode, 7, 1, 1}).second ? 0 : -EEXIST;
  }
  int MakeTemporaryDirectory(std::string& pathTemplate) override {
    const std::string suffix = std::to_string(1000000 + ++temporaryCount);
    pathTemplate.replace(pathTemplate.size() - suffix.size(), suffix.size(), suffix);
    return MakeDirectory(pathTemplate.c_str(), 0700);
  }
  int ChangeMode(const char* path, uint32_t mode) override {
    calls.push_back("chmod " + std::string(path) + " " + std::to_string(mode));
    return 0;
  }
  int RealPath(const char* path, std::string& resolved) override {
    const auto found = realPaths.find(path);
    if (found == realPaths.end() && !files.contains(path)) return -ENOENT;
    resolved = found == realPaths.end() ? path : found->second;
    return 0;
  }
  os::TreeWalk WalkTree(const char* root, const std::function<bool(const os::TreeNode&)>& visit) override {
    const std::string prefix = std::string(root) + "/";
    visit({os::TreeNode::Kind::DirectoryPreorder, root, 0, false, {}, -1});
    for (const auto& [path, status] : files) {
      if (path.starts_with(prefix)) visit({os::TreeNode::Kind::NonDirectory, path, 1, false, {}, -1});
    }
    visit({os::TreeNode::Kind::DirectoryPostorder, root, 0, false, {}, -1});
    return {};
  }
  int ReadFile(const char* path, size_t limit, std::vector<uint8_t>& bytes) override {
    const auto found = contents.find(path);
    if (found == contents.end()) return -ENOENT;
    bytes.assign(found->second.begin(), found->second.begin() + std::min(limit, found->second.size()));
    return 0;
  }
  // The image reads "image" through a real descriptor.
  int OpenImageFile(const char* path) override {
    calls.push_back("open-image " + std::string(path));
    FILE* file = std::tmpfile();
    std::fputs("image", file);
    const int fd = ::dup(fileno(file));
    std::fclose(file);
    return fd;
  }
  int64_t Read(int fd, std::span<uint8_t> buffer, uint64_t offset) override {
    const ssize_t count = ::pread(fd, buffer.data(), buffer.size(), static_cast<off_t>(offset));
    return count >= 0 ? count : -errno;
  }
  int TakeReadLease(int) override { return leaseResult; }
  bool HoldsReadLease(int) override { return leaseHeld; }
  int MountVolume(const char* type, const char* mountPoint, uint32_t flags,
                  const os::VolumeMountArguments& arguments) override {
    calls.push_back(std::string("mount ") + type + " " + arguments.devicePath + " " + mountPoint);
    mountFlags = flags;
    mountArguments = arguments;
    return mountResult;
  }
  int Unlink(const char* path) override {
    calls.push_back("unlink " + std::string(path));
    return files.erase(path) ? 0 : -ENOENT;
  }
  int Unmount(const char* path, bool force) override { return Record(force ? "force-unmount " : "unmount ", path); }
  int RemoveDirectory(const char* path) override { return Record("rmdir ", path); }
  int OpenDevice(const char* path) override { return Record("open ", path) + ::dup(STDIN_FILENO); }
  int EjectDevice(int) override { return Record("eject", ""); }

 private:
  int Record(const char* call, const char* path) {
    calls.push_back(call + std::string(path));
    return 0;
  }
};

// A manifest for this device whose image names `subType` and has a digest of
// `digestLength` bytes.
inline derwriter::Bytes ManifestOf(std::string_view subType, size_t digestLength = 48) {
  using namespace derwriter;
  const Bytes name(subType.begin(), subType.end());
  return testing_support::DefaultManifest(ManifestBody(
      testing_support::DefaultManifestProperties(),
      {{"pdmg", {DataProperty("DGST", Bytes(digestLength, 1)), DataProperty("pdnm", name)}}}));
}

struct DiskImageTest : ::testing::Test {
  FileTreeOs os;
  registry::RegistryModel registry;
  log::CaptureSink capture;
  ScopedServices services{Services{&registry, &os, nullptr, nullptr}};
};

}  // namespace brisvale::testing
