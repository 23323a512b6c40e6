#include "platform/linux/registry_disk_images.h"

#include <dirent.h>
#include <fcntl.h>
#include <linux/loop.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>

#include <cerrno>
#include <vector>

#include "base/hex.h"
#include "base/log.h"
#include "base/unique_fd.h"
#include "platform/crypto.h"
#include "platform/linux/format_attach_request.h"
#include "platform/linux/format_trust_cache.h"
#include "platform/linux/loop_device.h"

namespace brisvale::registry {
namespace {

constexpr Status kNotPermitted = 0xe00002e2;
constexpr uint32_t kAttachSelector = 0;
constexpr uint32_t kLoadTrustCacheSelector = 2;

// The attach list lives in the caller's memory, which is this process. It is copied
// with process_vm_readv rather than read through the pointer: an address that is not
// mapped then fails with EFAULT instead of taking the daemon down.
int CopyOwnMemory(const formats::AttachListLocation& location, std::vector<uint8_t>& bytes) {
  bytes.resize(location.length);
  const iovec local{bytes.data(), bytes.size()};
  const iovec remote{reinterpret_cast<void*>(static_cast<uintptr_t>(location.address)), bytes.size()};
  const ssize_t copied = ::process_vm_readv(::getpid(), &local, 1, &remote, 1, 0);
  if (copied < 0) return -errno;
  return static_cast<size_t>(copied) == bytes.size() ? 0 : -EFAULT;
}

bool IsPublished(RegistryModel& model, const std::string& identifier) {
  auto drives = model.GetMatchingServices(
      Matching::Class("KxNimbrelHDDriveInKernel").Set("nimbrel-unique-identifier", plist::Value(identifier)));
  return drives.ok() && drives.value && drives.value->Next() != nullptr;
}

class ControllerClient final : public UserClient {
 public:
  ControllerClient(RegistryModel& model, std::shared_ptr<const DiskImageServicesOptions> options)
      : model_(model), options_(std::move(options)) {}

  Status CallMethod(uint32_t selector, MethodArgs& args) override {
    if (selector != kAttachSelector) return kUnsupported;
    std::string error;
    const auto location = formats::ParseAttachRecord(args.structIn, &error);
    if (!location) {
      Log(Level::Default, "Disk image attach refused: %s.", error);
      return kBadArgument;
    }
    std::vector<uint8_t> list;
    if (const int rc = CopyOwnMemory(*location, list); rc < 0) {
      Log(Level::Default, "Disk image attach refused: unreadable property list: %{errno}d", -rc);
      return kBadArgument;
    }
    const auto request = formats::ParseAttachList(list, &error);
    if (!request) {
      Log(Level::Default, "Disk image attach refused: %s.", error);
      return kBadArgument;
    }
    const Status status = Attach(*request);
    if (status == kSuccess) args.structOut.assign(std::min<size_t>(4, args.structOutCapacity), 0);
    return status;
  }

 private:
  Status Attach(const formats::AttachRequest& request) {
    const char* path = request.imagePath.c_str();
    const UniqueFd image(::open(path, O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK));
    if (!image) {
      Log(Level::Default, "Failed to open disk image %s: %{errno}d", path, errno);
      return kNotFound;
    }
    struct stat status {};
    if (::fstat(image.get(), &status) != 0 || !S_ISREG(status.st_mode)) {
      Log(Level::Default, "Disk image %s is not a regular file.", path);
      return kBadArgument;
    }
    // Opened non-blocking only so that a FIFO or a device at the path cannot hang the
    // open; the loop driver reads the file normally.
    ::fcntl(image.get(), F_SETFL, 0);
    // The caller verified one file: attach that one or nothing. Another inode at the
    // path, or a second name through which it could be rewritten, is refused.
    if (const auto& verified = request.verifiedFile;
        verified && (status.st_dev != verified->device || status.st_ino != verified->inode ||
                     status.st_nlink != 1)) {
      Log(Level::Default, "Disk image %s is not the file that was verified.", path);
      return kNotPermitted;
    }
    loop::AttachOptions options;
    options.readOnly = true;
    options.partitionScan = true;
    options.identifier = request.identifier;
    options.deviceRoot = options_->deviceRoot;
    loop::LoopDevice device;
    if (const int rc = loop::Attach(image.get(), options, device); rc < 0) {
      Log(Level::Default, "Failed to attach %s to a loop device: %{errno}d", path, -rc);
      return kNoResources;
    }
    if (options_->rescanDevices) options_->rescanDevices();
    if (!IsPublished(model_, request.identifier)) {
      Log(Level::Default, "Disk image %s attached as %s but not published.", path, device.name());
      return kError;  // `device` detaches it; the next rescan drops what was published
    }
    Log(Level::Info, "Attached %s as %s.", path, device.name());
    device.Release();
    return kSuccess;
  }

  RegistryModel& model_;
  std::shared_ptr<const DiskImageServicesOptions> options_;
};

// Writes `bytes` to `directory`/`name` so that the name only ever shows a whole file.
int WriteAtomically(const std::string& directory, const std::string& name, std::span<const uint8_t> bytes) {
  ::mkdir(directory.c_str(), 0700);
  const UniqueFd dir(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!dir) return -errno;
  const std::string temporary = "." + name + "." + std::to_string(::getpid());
  UniqueFd file(::openat(dir.get(), temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (!file) return -errno;
  int error = 0;
  for (size_t done = 0; done < bytes.size() && !error;) {
    const ssize_t count = ::write(file.get(), bytes.data() + done, bytes.size() - done);
    if (count < 0 && errno != EINTR) error = -errno;
    if (count > 0) done += static_cast<size_t>(count);
  }
  if (!error && ::fsync(file.get()) != 0) error = -errno;
  file.Reset();
  if (!error && ::renameat(dir.get(), temporary.c_str(), dir.get(), name.c_str()) != 0) error = -errno;
  if (error) {
    ::unlinkat(dir.get(), temporary.c_str(), 0);
    return error;
  }
  ::fsync(dir.get());
  return 0;
}

class CodeIntegrityClient final : public UserClient {
 public:
  explicit CodeIntegrityClient(std::shared_ptr<const DiskImageServicesOptions> options)
      : options_(std::move(options)) {}

  Status CallMethod(uint32_t selector, MethodArgs& args) override {
    if (selector != kLoadTrustCacheSelector) return kUnsupported;
    if (const std::string problem = formats::CheckTrustCache(args.structIn); !problem.empty()) {
      Log(Level::Default, "Refusing trust cache: %s.", problem);
      return kBadArgument;
    }
    // Named by its digest: the same cache loaded again replaces itself.
    std::array<uint8_t, crypto::kSha256Length> digest{};
    if (!crypto::Digest(crypto::DigestAlgorithm::Sha256, args.structIn, digest)) return kError;
    const std::string name = *BrisvaleMounter::hexStringWithData(std::span<const uint8_t>(digest)) + ".trustcache";
    if (const int rc = WriteAtomically(options_->trustCacheDirectory, name, args.structIn); rc < 0) {
      Log(Level::Default, "Failed to keep trust cache in %s: %{errno}d", options_->trustCacheDirectory, -rc);
      return kNoResources;
    }
    return kSuccess;
  }

 private:
  std::shared_ptr<const DiskImageServicesOptions> options_;
};

std::string ReadSysfsText(const std::string& path) {
  std::vector<uint8_t> bytes(4096);
  const UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  const ssize_t count = fd ? ::read(fd.get(), bytes.data(), bytes.size()) : -1;
  std::string text(bytes.begin(), bytes.begin() + std::max<ssize_t>(count, 0));
  while (!text.empty() && text.back() == '\n') text.pop_back();
  return text;
}

template <typename Client, typename... Args>
UserClientFactory TypeZeroClients(Args... args) {
  return [=](uint32_t type) -> Result<std::unique_ptr<UserClient>> {
    if (type != 0) return {kBadArgument, nullptr};
    return {kSuccess, std::make_unique<Client>(args...)};
  };
}

}  // namespace

DiskImageServices::DiskImageServices(RegistryModel& model, DiskImageServicesOptions options)
    : model_(model), options_(std::make_shared<const DiskImageServicesOptions>(std::move(options))) {
  controller_ = model_.Publish(nullptr, "KxNimbrelController", {});
  model_.SetUserClientFactory(controller_, TypeZeroClients<ControllerClient>(std::ref(model_), options_));
  codeIntegrity_ = model_.Publish(nullptr, "Ferrovane", {});
  model_.SetUserClientFactory(codeIntegrity_, TypeZeroClients<CodeIntegrityClient>(options_));
}

DiskImageServices::~DiskImageServices() {
  model_.Terminate(codeIntegrity_);
  model_.Terminate(controller_);
}

int DetachAbandonedImageDevices(const std::string& root) {
  std::string prefix = root;
  while (prefix.size() > 1 && prefix.back() == '/') prefix.pop_back();
  if (prefix != "/") prefix += '/';
  int detached = 0;
  const UniqueFd blocks(::open("/sys/block", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!blocks) return 0;
  DIR* directory = ::fdopendir(::dup(blocks.get()));
  if (!directory) return 0;
  std::vector<std::string> names;
  while (const dirent* entry = ::readdir(directory)) {
    if (std::string_view(entry->d_name).starts_with("loop")) names.emplace_back(entry->d_name);
  }
  ::closedir(directory);
  for (const std::string& name : names) {
    std::string backing = ReadSysfsText("/sys/block/" + name + "/loop/backing_file");
    if (backing.ends_with(" (deleted)")) backing.resize(backing.size() - 10);
    if (!backing.starts_with(prefix)) continue;  // unattached, or another root's image
    // An exclusive open fails while a file system (or anyone else) holds the device:
    // what is mounted is never touched.
    const UniqueFd device(::open(("/dev/" + name).c_str(), O_RDONLY | O_EXCL | O_CLOEXEC | O_NONBLOCK));
    if (!device) continue;
    std::string identifier;
    if (loop::ReadIdentifier(device.get(), identifier) < 0 || !formats::IsUuidText(identifier)) continue;
    if (::ioctl(device.get(), LOOP_CLR_FD) == 0) {
      Log(Level::Default, "Detached %s, left attached to %s without a mount.", name, backing);
      ++detached;
    }
  }
  return detached;
}

}  // namespace brisvale::registry
