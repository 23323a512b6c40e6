#include "mount_image.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <optional>

#include "base/hex.h"
#include "base/unique_fd.h"
#include "json.h"
#include "platform/os.h"
#include "platform/services.h"
#include "verify/container/qor4.h"
#include "verify/image_digest.h"

namespace brisvale::tools {
namespace {

constexpr int kOk = 0, kRequestFailed = 1, kUsage = 2, kLocalError = 5;
// Below the daemon's personalized and factory roots, so the start-up clean-up never
// sees it, and free of links so the daemon's path check accepts what is staged there.
constexpr const char* kStagingDirectory = "/private/var/run/brisvale_staging";
constexpr off_t kProgressThreshold = 8 << 20;

struct MountImageOptions {
  std::string type, signaturePath, imagePath;
  bool consume = false;
};

std::optional<MountImageOptions> Parse(const std::vector<std::string>& arguments) {
  MountImageOptions options;
  for (size_t i = 0; i < arguments.size(); ++i) {
    const std::string& arg = arguments[i];
    if (arg == "--type" && i + 1 < arguments.size()) {
      options.type = arguments[++i];
    } else if (arg == "--signature" && i + 1 < arguments.size()) {
      options.signaturePath = arguments[++i];
    } else if (arg == "--consume") {
      options.consume = true;
    } else if (!arg.starts_with("--") && options.imagePath.empty()) {
      options.imagePath = arg;
    } else {
      return std::nullopt;
    }
  }
  if (options.type != "Developer" && options.type != "Factory" && options.type != "Personalized") {
    return std::nullopt;
  }
  if (options.signaturePath.empty() || options.imagePath.empty()) return std::nullopt;
  return options;
}

int LocalError(const std::string& what, int error) {
  std::fprintf(stderr, "brisvalectl: %s: %s\n", what.c_str(), std::strerror(error));
  return kLocalError;
}

// The digest the daemon will compute: SHA-1, or what a manifest's "pdmg" digest asks.
std::optional<plist::Bytes> ImageDigest(const MountImageOptions& options, const plist::Bytes& signature) {
  long length = 20;
  if (options.type == "Personalized") {
    Qor4DecodeContext context{};
    const uint8_t* data = nullptr;
    uint32_t dataLength = 0;
    if (signature.size() < UINT32_MAX &&
        Qor4DecodeInitManifest(signature.data(), static_cast<uint32_t>(signature.size()), &context) == 0 &&
        Qor4DecodeGetObjectPropertyData(&context, Qor4Code("pdmg"), 0, Qor4Code("DGST"), 0, &data,
                                        &dataLength) == 0) {
      length = dataLength;
    }
  }
  std::vector<uint8_t> digest;
  // The digest code reads through the platform's file calls, as it does in the daemon.
  const ScopedServices services(Services{.os = &os::SystemOs()});
  if (verify::DigestImageFile(options.imagePath, &digest, length == 48 ? 48 : 20) != 0) return std::nullopt;
  return digest;
}

void ShowProgress(off_t done, off_t total) {
  const int width = 40;
  const int filled = total ? static_cast<int>(done * width / total) : width;
  std::fprintf(stderr, "\rstaging [%.*s%*s] %3d%%", filled, "########################################",
               width - filled, "", total ? static_cast<int>(done * 100 / total) : 100);
  if (done == total) std::fputc('\n', stderr);
}

// A reflink where the file system shares blocks, else a kernel-side copy.
int CopyInto(int from, int to, off_t size) {
  if (ioctl(to, FICLONE, from) == 0) return 0;
  const bool progress = isatty(STDERR_FILENO) && size > kProgressThreshold;
  for (off_t done = 0; done < size;) {
    const ssize_t copied = copy_file_range(from, nullptr, to, nullptr, size_t{16} << 20, 0);
    if (copied < 0 && errno == EINTR) continue;
    if (copied < 0) return errno;
    if (copied == 0) return EIO;  // the file shrank under us
    done += copied;
    if (progress) ShowProgress(done, size);
  }
  return 0;
}

// The staged copy's path inside the root: two directories spelling the digest, which
// is how the daemon tells an identical image already mounted.
std::string StagedPath(const std::string& root, const plist::Bytes& digest, const std::string& imagePath,
                       std::string& head, std::string& tail) {
  const std::string hex = BrisvaleMounter::hexStringWithData(std::span<const uint8_t>(digest)).value_or("00");
  head = std::string(kStagingDirectory) + "/" + hex.substr(0, 2);
  tail = head + "/" + hex.substr(2);
  const size_t slash = imagePath.rfind('/');
  const std::string name = slash == std::string::npos ? imagePath : imagePath.substr(slash + 1);
  for (const std::string& dir : {root + "/private/var/run", root + kStagingDirectory, root + head, root + tail}) {
    mkdir(dir.c_str(), 0700);
  }
  return tail + "/" + std::to_string(getpid()) + "-" + name;
}

}  // namespace

int PrintMountReply(const plist::Value& reply, bool json) {
  const std::string* status = reply.getString("Status");
  const bool ok = status && *status == "Success";
  if (json) {
    std::printf("%s\n", ToJson(reply).c_str());
  } else if (ok) {
    // A FAT or exFAT medium is listed but not mounted: its "mount path" is the node.
    const std::string* mountPath = reply.getString("MountPath");
    std::printf("%s\n", mountPath ? mountPath->c_str() : "");
  } else {
    std::fprintf(stderr, "brisvalectl: the daemon answered Failure (its log says why)\n");
  }
  return ok ? kOk : kRequestFailed;
}

int MountImage(const std::vector<std::string>& arguments, const std::string& root, bool json,
               const RequestSender& send) {
  const std::optional<MountImageOptions> options = Parse(arguments);
  if (!options) {
    std::fprintf(stderr,
                 "usage: brisvalectl mount-image --type Developer|Factory|Personalized "
                 "--signature FILE IMAGE [--consume]\n");
    return kUsage;
  }
  std::ifstream file(options->signaturePath, std::ios::binary);
  if (!file) return LocalError("cannot read " + options->signaturePath, errno);
  const plist::Bytes signature((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());

  std::string daemonPath, head, tail;
  if (options->consume) {
    // The daemon sees the file at its path below the root.
    char* resolved = realpath(options->imagePath.c_str(), nullptr);
    char* resolvedRoot = realpath(root.empty() ? "/" : root.c_str(), nullptr);
    if (resolved && resolvedRoot) {
      const std::string path = resolved, prefix = std::strcmp(resolvedRoot, "/") == 0 ? "" : resolvedRoot;
      if (path.starts_with(prefix + "/")) daemonPath = path.substr(prefix.size());
    }
    std::free(resolved);
    std::free(resolvedRoot);
    if (daemonPath.empty()) {
      std::fprintf(stderr, "brisvalectl: %s is not inside the daemon's root\n", options->imagePath.c_str());
      return kUsage;
    }
  } else {
    const UniqueFd source(open(options->imagePath.c_str(), O_RDONLY | O_CLOEXEC));
    struct stat st {};
    if (source.get() < 0 || fstat(source.get(), &st) < 0) return LocalError("cannot read " + options->imagePath, errno);
    const std::optional<plist::Bytes> digest = ImageDigest(*options, signature);
    if (!digest) return LocalError("cannot digest " + options->imagePath, EIO);
    daemonPath = StagedPath(root, *digest, options->imagePath, head, tail);
    const std::string staged = root + daemonPath;
    const UniqueFd target(open(staged.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
    if (target.get() < 0) return LocalError("cannot stage " + staged, errno);
    if (const int error = CopyInto(source.get(), target.get(), st.st_size); error != 0) {
      unlink(staged.c_str());
      return LocalError("cannot stage " + staged, error);
    }
  }

  auto result = send(plist::Dictionary{{"RequestType", "Mount"},
                                       {"DeviceType", "DiskImage"},
                                       {"DiskImageType", plist::Value(options->type)},
                                       {"ImageSignature", plist::Value(signature)},
                                       {"DiskImagePath", plist::Value(daemonPath)}});
  if (!options->consume) {
    // The daemon consumed the copy; an unread request leaves it, and either way the
    // staging directories go when empty.
    unlink((root + daemonPath).c_str());
    rmdir((root + tail).c_str());
    rmdir((root + head).c_str());
  }
  if (const int* status = std::get_if<int>(&result)) return *status;
  return PrintMountReply(std::get<plist::Value>(result), json);
}

}  // namespace brisvale::tools
