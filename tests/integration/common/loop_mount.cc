// Ext4 images built with mkfs.ext4 and loop-mounted for the integration tests.
#include "loop_mount.h"

#include <fcntl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>

#include "base/unique_fd.h"
#include "platform/linux/os_system.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {

bool MakeExt4Image(const std::string& imagePath, int sizeMiB, const std::string& contentDir,
                   std::string* error) {
  std::vector<std::string> argv = {"/sbin/mkfs.ext4", "-q", "-F", "-O", "^has_journal"};
  if (!contentDir.empty()) argv.insert(argv.end(), {"-d", contentDir});
  argv.insert(argv.end(), {imagePath, std::to_string(sizeMiB) + "M"});
  std::string output;
  if (RunProgram(argv, &output) == 0) return true;
  if (error) *error = "mkfs.ext4 failed: " + output;
  return false;
}

std::vector<std::string> MountPointsBelow(const std::string& dir) {
  std::vector<os::MountRecord> table;
  EXPECT_GE(os::ReadWholeMountTable("/proc/self/mountinfo", table), 0);
  std::vector<std::string> found;
  for (const os::MountRecord& mount : table) {
    if (mount.mountedOn == dir || mount.mountedOn.starts_with(dir + "/")) found.push_back(mount.mountedOn);
  }
  return found;
}

std::unique_ptr<LoopMount> LoopMount::Create(const std::string& imagePath, const std::string& mountPoint,
                                             const std::string& devRoot, bool readOnly,
                                             std::string* error) {
  auto fail = [&](const std::string& what, int errorNumber) {
    if (error) *error = what + ": " + strerror(errorNumber);
    return nullptr;
  };
  std::unique_ptr<LoopMount> mount(new LoopMount);
  const UniqueFd image(open(imagePath.c_str(), (readOnly ? O_RDONLY : O_RDWR) | O_CLOEXEC));
  if (!image) return fail("open " + imagePath, errno);
  const loop::AttachOptions options{.readOnly = readOnly, .autoclear = true, .identifier = imagePath};
  if (const int rc = loop::Attach(image.get(), options, mount->loop_); rc < 0) {
    return fail("attach " + imagePath, -rc);
  }
  const std::string device = "/dev/" + mount->loop_.name();
  const std::string node = devRoot + "/" + mount->loop_.name();
  if (access(node.c_str(), F_OK) != 0) {
    if (mknod(node.c_str(), S_IFBLK | 0660, mount->loop_.deviceNumber()) != 0) return fail("mknod " + node, errno);
    mount->nodeCreated_ = node;
  }
  if (::mount(device.c_str(), mountPoint.c_str(), "ext4", readOnly ? MS_RDONLY : 0, nullptr) != 0) {
    return fail("mount " + device + " on " + mountPoint, errno);
  }
  mount->device_ = device;
  mount->mountPoint_ = mountPoint;
  return mount;
}

LoopMount::~LoopMount() {
  // The daemon may have taken the file system away already; detaching is harmless then.
  if (!mountPoint_.empty()) umount2(mountPoint_.c_str(), MNT_DETACH);
  // loop_ then detaches the device, in case the test left it mounted elsewhere.
  loop_.Detach();
  if (!nodeCreated_.empty()) unlink(nodeCreated_.c_str());
}

}  // namespace brisvale::testing
