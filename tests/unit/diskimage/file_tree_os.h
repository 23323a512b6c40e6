// An operating system whose files are a table the test fills: lstat, realpath, the
// directory calls and the tree walk answer from it, and every call that changes
// something is recorded.
#pragma once

#include <unistd.h>

#include <cstdio>
#include <map>
#include <string>
#include <vector>

#include "fake_os.h"

namespace brisvale::testing {

inline constexpr uint32_t kDirectory = 0040755, kFile = 0100644, kLink = 0120777;

class FileTreeOs : public FakeOs {
 public:
  std::map<std::string, os::FileStatus, std::less<>> files;
  std::map<std::string, int, std::less<>> mkdirErrors;   // -errno by path
  std::map<std::string, std::string, std::less<>> realPaths;  // when not the path itself
  std::vector<std::string> calls;
  int temporaryCount = 0;
  // The image file as opened: its contents and what fstat says of it.
  std::string imageBytes = "image";
  std::optional<os::FileStatus> openedStatus;
  int leaseResult = 0;
  bool leaseHeld = true;

  void AddFile(const std::string& path, uint32_t mode, uint64_t inode = 1) {
    files[path] = os::FileStatus{mode, 7, inode, 1};
  }

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
    if (files.contains(path)) return -EEXIST;
    files[path] = os::FileStatus{0040000 | mode, 7, 100, 1};
    return 0;
  }
  int MakeTemporaryDirectory(std::string& pathTemplate) override {
    const std::string suffix = std::to_string(1000000 + ++temporaryCount);
    pathTemplate.replace(pathTemplate.size() - suffix.size(), suffix.size(), suffix);
    return MakeDirectory(pathTemplate.c_str(), 0700);
  }
  int ChangeMode(const char* path, uint32_t mode) override {
    char text[16];
    std::snprintf(text, sizeof text, " %o", mode);
    calls.push_back("chmod " + std::string(path) + text);
    return 0;
  }
  int RealPath(const char* path, std::string& resolved) override {
    if (const auto found = realPaths.find(path); found != realPaths.end()) {
      resolved = found->second;
      return 0;
    }
    if (!files.contains(path)) return -ENOENT;
    resolved = path;
    return 0;
  }
  os::TreeWalk WalkTree(const char* root, const std::function<bool(const os::TreeNode&)>& visit) override {
    if (!files.contains(root)) return {-ENOENT, 0};
    const std::string prefix = std::string(root) + "/";
    visit({os::TreeNode::Kind::DirectoryPreorder, root, 0, false});
    for (const auto& [path, status] : files) {
      if (path.starts_with(prefix)) visit({os::TreeNode::Kind::NonDirectory, path, 1, false});
    }
    visit({os::TreeNode::Kind::DirectoryPostorder, root, 0, false});
    return {};
  }
  int OpenImageFile(const char* path) override {
    calls.push_back("open-image " + std::string(path));
    FILE* file = std::tmpfile();
    std::fwrite(imageBytes.data(), 1, imageBytes.size(), file);
    const int fd = ::dup(fileno(file));
    std::fclose(file);
    return fd;
  }
  int TakeReadLease(int) override { return leaseResult; }
  bool HoldsReadLease(int) override { return leaseHeld; }
  int Unlink(const char* path) override {
    calls.push_back("unlink " + std::string(path));
    return files.erase(path) ? 0 : -ENOENT;
  }
  int Unmount(const char* path, bool) override {
    calls.push_back("force-unmount " + std::string(path));
    return 0;
  }
  int RemoveDirectory(const char* path) override {
    calls.push_back("rmdir " + std::string(path));
    return 0;
  }
  int OpenDevice(const char* path) override {
    calls.push_back("open " + std::string(path));
    return ::dup(STDIN_FILENO);
  }
  int EjectDevice(int) override {
    calls.push_back("eject");
    return 0;
  }
};

}  // namespace brisvale::testing
