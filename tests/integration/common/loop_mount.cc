// Ext4 images built with mkfs.ext4 and loop-mounted for the integration tests.
#include "loop_mount.h"

#include <fcntl.h>
#include <linux/loop.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "base/unique_fd.h"
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

std::unique_ptr<LoopMount> LoopMount::Create(const std::string& imagePath, const std::string& mountPoint,
                                             const std::string& devRoot, bool readOnly,
                                             std::string* error) {
  auto fail = [&](const std::string& what) {
    if (error) *error = what + ": " + strerror(errno);
    return nullptr;
  };
  std::unique_ptr<LoopMount> mount(new LoopMount);
  const UniqueFd control(open("/dev/loop-control", O_RDWR | O_CLOEXEC));
  if (!control) return fail("open /dev/loop-control");
  const UniqueFd image(open(imagePath.c_str(), (readOnly ? O_RDONLY : O_RDWR) | O_CLOEXEC));
  if (!image) return fail("open " + imagePath);

  // Another process may take the free device between the two calls; try again then.
  for (int attempt = 0; attempt < 8 && mount->loopFd_ < 0; ++attempt) {
    const int number = ioctl(control.get(), LOOP_CTL_GET_FREE);
    if (number < 0) return fail("LOOP_CTL_GET_FREE");
    const std::string device = "/dev/loop" + std::to_string(number);
    UniqueFd loop(open(device.c_str(), O_RDWR | O_CLOEXEC));
    if (!loop) continue;
    loop_config config{};
    config.fd = static_cast<uint32_t>(image.get());
    config.info.lo_flags = LO_FLAGS_AUTOCLEAR | (readOnly ? LO_FLAGS_READ_ONLY : 0);
    strncpy(reinterpret_cast<char*>(config.info.lo_file_name), imagePath.c_str(), LO_NAME_SIZE - 1);
    if (ioctl(loop.get(), LOOP_CONFIGURE, &config) != 0) {
      if (errno == EBUSY) continue;
      return fail("LOOP_CONFIGURE " + device);
    }
    mount->device_ = device;
    mount->loopFd_ = loop.release();
  }
  if (mount->loopFd_ < 0) return fail("no free loop device");

  const std::string node = devRoot + mount->device_.substr(4);
  struct stat status {};
  if (stat(node.c_str(), &status) != 0) {
    struct stat real {};
    if (fstat(mount->loopFd_, &real) != 0 || mknod(node.c_str(), S_IFBLK | 0660, real.st_rdev) != 0) {
      return fail("mknod " + node);
    }
    mount->nodeCreated_ = node;
  }
  if (::mount(mount->device_.c_str(), mountPoint.c_str(), "ext4", readOnly ? MS_RDONLY : 0, nullptr) != 0) {
    return fail("mount " + mount->device_ + " on " + mountPoint);
  }
  mount->mountPoint_ = mountPoint;
  return mount;
}

LoopMount::~LoopMount() {
  // The daemon may have taken the file system away already; detaching is harmless then.
  if (!mountPoint_.empty()) umount2(mountPoint_.c_str(), MNT_DETACH);
  if (loopFd_ >= 0) {
    // With autoclear the device lets go of the image once unmounted and closed; clear
    // it outright in case the test left it mounted elsewhere.
    ioctl(loopFd_, LOOP_CLR_FD);
    close(loopFd_);
  }
  if (!nodeCreated_.empty()) unlink(nodeCreated_.c_str());
}

}  // namespace brisvale::testing
