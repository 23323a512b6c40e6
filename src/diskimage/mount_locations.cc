#include "diskimage/mount_locations.h"

#include <array>
#include <cerrno>
#include <limits>
#include <vector>

#include "base/log.h"
#include "platform/os.h"
#include "platform/services.h"
#include "verify/container/qor4.h"

namespace brisvale {
namespace {

constexpr uint32_t kDirectoryMode = 0755;
constexpr const char* kDeveloperCertificate = "/System/Library/Tethra/CorvexDebug.pem";
constexpr const char* kFactoryRoot = "/private/var/factory_mount";
constexpr const char* kTemporarySuffix = "XXXXXXX";
constexpr const char* kPersonalizedNotification = "com.vantrel.mobile.personalized_image_mounted";

struct PersonalizedKind {
  std::string_view subType;
  const char* base;
  bool freshDirectory;
};
// In the order they are compared.
constexpr std::array<PersonalizedKind, 6> kPersonalizedKinds{{
    {"DebugDiskImage", "/private/var/personalized_debug", false},
    {"DemoDiskImage", "/private/var/personalized_demo", false},
    {"DeveloperDiskImage", "/Developer", false},
    {"FactoryDiskImage", "/private/var/personalized_factory", true},
    {"AutomationDiskImage", "/private/var/personalized_automation", false},
    {"ProdAutomationDiskImage", "/private/var/personalized_automation", false},
}};

// Mount roots made on demand when missing; each is compared as a prefix but the first.
constexpr std::string_view kCreatableExact = "/private/var/debug_mount";
constexpr std::array<std::string_view, 5> kCreatablePrefixes{
    "/private/var/factory_mount",   "/private/var/personalized_automation",
    "/private/var/personalized_debug", "/private/var/personalized_demo",
    "/private/var/personalized_factory"};

bool IsCreatableRoot(std::string_view path) {
  if (path == kCreatableExact) return true;
  for (std::string_view prefix : kCreatablePrefixes) {
    if (path.starts_with(prefix)) return true;
  }
  return false;
}

os::Os& Os() { return *CurrentServices().os; }

// `base` + "/XXXXXXX" made into a new directory of mode 0755; none after logging.
std::optional<std::string> MakeFreshDirectory(const char* base, bool personalized) {
  std::string path = std::string(base) + "/" + kTemporarySuffix;
  if (path.size() >= kMaxImagePathLength) {
    if (personalized) {
      Log(Level::Default, "Failed to create path: > %ld", static_cast<long>(kMaxImagePathLength));
    } else {
      Log(Level::Default, "Invalid path size.");
    }
    return std::nullopt;
  }
  if (const int rc = Os().MakeTemporaryDirectory(path); rc < 0) {
    Log(Level::Default, "Failed to create %s: %{errno}d", path.c_str(), -rc);
    return std::nullopt;
  }
  // mkdtemp makes it 0700 whatever the umask; the mounted volume must be reachable.
  Os().ChangeMode(path.c_str(), kDirectoryMode);
  return path;
}

}  // namespace

std::optional<std::span<const uint8_t>> CopyManifestImageProperty(std::span<const uint8_t> manifest,
                                                                  uint32_t tag) {
  Qor4DecodeContext context{};
  const int decoded = manifest.size() > std::numeric_limits<uint32_t>::max()
                          ? static_cast<int>(DERResultOverflow)
                          : Qor4DecodeInitManifest(manifest.data(),
                                                   static_cast<uint32_t>(manifest.size()), &context);
  if (decoded != 0) {
    Log(Level::Default, "Failed to decode qor4 manifest: %d", decoded);
    return std::nullopt;
  }
  const uint8_t* data = nullptr;
  uint32_t length = 0;
  const int read = Qor4DecodeGetObjectPropertyData(&context, Qor4Code("pdmg"), 0, tag, 0, &data, &length);
  if (read != 0) {
    Log(Level::Default, "Failed to retrieve data from manifest: %d", read);
    return std::nullopt;
  }
  return std::span<const uint8_t>(data, length);
}

std::optional<std::string> CopyPersonalizedSubType(std::span<const uint8_t> manifest) {
  const std::optional<std::span<const uint8_t>> name = CopyManifestImageProperty(manifest, Qor4Code("pdnm"));
  if (!name) return std::nullopt;
  // Compared and logged as C text: anything after an embedded NUL does not count.
  std::string subType(reinterpret_cast<const char*>(name->data()), name->size());
  subType.resize(std::char_traits<char>::length(subType.c_str()));
  return subType;
}

std::optional<MountLocation> ResolveMountLocation(std::string_view diskImageType,
                                                  std::span<const uint8_t> imageSignature) {
  if (diskImageType == "Developer") {
    return MountLocation{"/Developer", std::nullopt, kDeveloperCertificate,
                         "com.vantrel.mobile.developer_image_mounted"};
  }
  if (diskImageType == "Factory") {
    if (const int rc = Os().MakeDirectory(kFactoryRoot, kDirectoryMode); rc < 0 && rc != -EEXIST) {
      Log(Level::Default, "Failed to create %s: %{errno}d", kFactoryRoot, -rc);
      return std::nullopt;
    }
    std::optional<std::string> path = MakeFreshDirectory(kFactoryRoot, false);
    if (!path) return std::nullopt;
    return MountLocation{std::move(*path), std::nullopt, kDeveloperCertificate,
                         "com.vantrel.mobile.factory_image_mounted"};
  }
  if (diskImageType == "Personalized") {
    std::optional<std::string> subType = CopyPersonalizedSubType(imageSignature);
    if (!subType) return std::nullopt;
    const PersonalizedKind* kind = nullptr;
    for (const PersonalizedKind& candidate : kPersonalizedKinds) {
      if (candidate.subType == *subType) {
        kind = &candidate;
        break;
      }
    }
    if (!kind) {
      Log(Level::Default, "Invalid personalized disk image type: %s", subType->c_str());
      return std::nullopt;
    }
    if (const int rc = Os().MakeDirectory(kind->base, kDirectoryMode); rc < 0 && rc != -EEXIST) {
      Log(Level::Default, "Failed to create mount path %s: %{errno}d", kind->base, -rc);
      return std::nullopt;
    }
    std::string mountPath = kind->base;
    if (kind->freshDirectory) {
      std::optional<std::string> path = MakeFreshDirectory(kind->base, true);
      if (!path) return std::nullopt;
      mountPath = std::move(*path);
    }
    return MountLocation{std::move(mountPath), std::move(subType), std::nullopt,
                         kPersonalizedNotification};
  }
  Log(Level::Default, "Unsupported disk image type: %@", diskImageType);
  return std::nullopt;
}

int ValidateMountPoint(std::string_view mountPathView) {
  if (mountPathView.size() > kMaxImagePathLength) {
    Log(Level::Default, "Failed to create string.");
    return -1;
  }
  const std::string mountPath(mountPathView);
  const char* path = mountPath.c_str();
  os::FileStatus status;
  if (int rc = Os().StatPath(path, status); rc < 0) {
    if (rc == -ENOENT && IsCreatableRoot(mountPath)) {
      rc = Os().MakeDirectory(path, kDirectoryMode);
      if (rc == 0) return 0;
      Log(Level::Default, "Failed to create %s: %{errno}d", path, -rc);
    }
    Log(Level::Default, "Failed to lstat %s: %{errno}d", path, -rc);
    return -1;
  }
  if ((status.mode & os::kFileTypeMask) != os::kFileTypeDirectory) {
    Log(Level::Default, "%s is not a directory.", path);
    return -1;
  }
  bool notEmpty = false;
  const os::TreeWalk walk = Os().WalkTree(path, [&](const os::TreeNode& node) {
    if (node.path != mountPath) {
      Log(Level::Info, "Mount path %s is not empty: %s", path, node.path.c_str());
      notEmpty = true;
    }
    return true;
  });
  if (walk.openError) {
    Log(Level::Default, "Failed to open path for traversal: %{errno}d", -walk.openError);
    return -1;
  }
  if (walk.closeError) {
    Log(Level::Default, "Failed to close file traversal handle: %{errno}d", -walk.closeError);
    return -1;
  }
  if (notEmpty) {
    Log(Level::Default, "%s is not empty.", path);
    return -1;
  }
  return 0;
}

bool HasSymbolicLinkInPath(std::string_view path) {
  // "/a/b" is checked as "/a/b", then "/a", then "/".
  std::string prefix(path);
  while (!prefix.empty()) {
    os::FileStatus status;
    const int rc = Os().StatPath(prefix.c_str(), status);
    if (rc == 0 && (status.mode & os::kFileTypeMask) == 0xA000) return true;
    if (rc < 0 && rc != -ENOENT) {
      Log(Level::Default, "stat failed for %s : %{errno}d", prefix.c_str(), -rc);
      return false;
    }
    if (prefix == "/") break;
    while (prefix.size() > 1 && prefix.back() == '/') prefix.pop_back();
    const size_t slash = prefix.rfind('/');
    if (slash == std::string::npos) break;
    prefix.resize(slash == 0 ? 1 : slash);
  }
  return false;
}

bool IsUnsafePath(std::string_view path) {
  std::string resolved;
  const std::string text(path);
  if (path.size() < kMaxImagePathLength + 1 && !HasSymbolicLinkInPath(path) &&
      Os().RealPath(text.c_str(), resolved) == 0 && resolved == path) {
    return false;
  }
  if (resolved.size() > kMaxImagePathLength) resolved.clear();
  Log(Level::Default, "Paths don't match: (%s/%s)", text.c_str(), resolved.c_str());
  return true;
}

}  // namespace brisvale
