// The image volume mount. The platform's "hfs" mount becomes a Linux mount(2) of what
// the device really holds: HFS+ and HFSX volumes (also wrapped in HFS) as "hfsplus",
// and the read-only image file systems Linux tools build by their own type. Every mount
// is read-only, without set-user-id programs and without device nodes.
#include <blkid.h>
#include <sys/mount.h>

#include <cerrno>
#include <memory>
#include <string>

#include "base/log.h"
#include "platform/linux/os_system.h"

namespace brisvale::os {
namespace {

struct ProbeDeleter {
  void operator()(blkid_probe probe) const { blkid_free_probe(probe); }
};

// The file-system type libblkid finds on `devicePath`, or an empty text.
std::string ProbeType(const char* devicePath, int& error) {
  error = 0;
  std::unique_ptr<blkid_struct_probe, ProbeDeleter> probe(blkid_new_probe_from_filename(devicePath));
  if (!probe) {
    error = errno ? errno : EIO;
    return {};
  }
  blkid_probe_enable_superblocks(probe.get(), 1);
  blkid_probe_set_superblocks_flags(probe.get(), BLKID_SUBLKS_TYPE);
  if (blkid_do_safeprobe(probe.get()) != 0) return {};
  const char* type = nullptr;
  if (blkid_probe_lookup_value(probe.get(), "TYPE", &type, nullptr) != 0 || !type) return {};
  return type;
}

}  // namespace

int LinuxOs::MountVolume(const char* type, const char* mountPoint, [[maybe_unused]] uint32_t flags,
                         const VolumeMountArguments& arguments) {
  if (std::string_view(type) != "hfs") return -ENODEV;
  int error = 0;
  const std::string probed = ProbeType(arguments.devicePath.c_str(), error);
  if (error) return -error;
  std::string data;
  if (probed == "hfsplus") {
    // Linux's hfsplus keeps names in Unicode and takes no text encoding; the owner and
    // the permission mask carry over.
    data = "uid=" + std::to_string(arguments.ownerUid) + ",gid=" + std::to_string(arguments.ownerGid) +
           ",umask=" + std::to_string(0777 & ~arguments.permissionMask);
    Log(Level::Debug, "Text encoding %u not passed to hfsplus for %s.", arguments.textEncoding,
        arguments.devicePath);
  } else if (probed != "erofs" && probed != "squashfs" && probed != "ext4") {
    return -EINVAL;  // what mount(2) answers for a volume no file system recognises
  }
  // Always read-only whatever `flags` says. Linux has no union mount: kMountUnion (a
  // mount on "/") simply covers what was there.
  const unsigned long linuxFlags = MS_RDONLY | MS_NOSUID | MS_NODEV;
  if (::mount(arguments.devicePath.c_str(), mountPoint, probed.c_str(), linuxFlags,
              data.empty() ? nullptr : data.c_str()) != 0) {
    return -errno;
  }
  return 0;
}

int LinuxOs::EncodingBias(const char*, int32_t&) {
  // No Linux file system keeps an encoding bias.
  return -ENOTSUP;
}

}  // namespace brisvale::os
