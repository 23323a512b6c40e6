#include "diskimage/trust_cache.h"

#include <cerrno>
#include <cstdint>
#include <memory>
#include <string>

#include "base/log.h"
#include "base/unique_fd.h"
#include "platform/device_registry.h"
#include "platform/os.h"
#include "platform/services.h"

namespace brisvale {
namespace {

constexpr uint32_t kUserClientType = 0;
constexpr uint32_t kLoadTrustCacheSelector = 2;
constexpr registry::Status kLowBits = 0x3FFF;

}  // namespace

int LoadTrustCache(std::string_view mountPath) {
  const std::string path = std::string(mountPath) + "/.TrustCache";
  if (mountPath.size() >= os::kPathBufferSize || path.size() >= os::kPathBufferSize) {
    Log(Level::Default, "Failed to create string.");
    return -1;
  }
  os::Os& os = *CurrentServices().os;
  const int opened = os.OpenFile(path.c_str());
  if (opened < 0) {
    Log(Level::Default, "Failed to open %s: %{errno}d", path, -opened);
    return opened == -ENOENT ? 0 : -1;  // an image without a trust cache is fine
  }
  // Declared in release order reversed: the user client goes first, then the service,
  // the mapping and the descriptor.
  const UniqueFd fd(opened);
  uint64_t size = 0;
  if (const int rc = os.FileSize(fd.get(), size); rc < 0) {
    Log(Level::Default, "Failed to fstat %s: %{errno}d", path, -rc);
    return -1;
  }
  // Private and read-only: the service gets the bytes as they were when mapped. The
  // platform maps without caching as well; Linux has no MAP_NOCACHE.
  std::unique_ptr<os::FileMapping> mapping;
  if (size > SIZE_MAX || os.MapFile(fd.get(), static_cast<size_t>(size), mapping) < 0) {
    Log(Level::Default, "Failed to mmap %s.", path);
    return -1;
  }
  registry::DeviceRegistry& registry = *CurrentServices().registry;
  const registry::ObjectRef service = registry.GetMatchingService(registry::Matching::Class("Ferrovane"));
  if (!service) {
    Log(Level::Default, "KxServiceGetMatchingService failed.");
    return -1;
  }
  auto client = registry.Open(service, kUserClientType);
  if (!client.ok()) {
    Log(Level::Default, "KxServiceOpen failed: 0x%04x", client.status & kLowBits);
    return -1;
  }
  registry::MethodArgs args;
  args.structIn = mapping->Bytes();
  if (const registry::Status status = client.value->CallMethod(kLoadTrustCacheSelector, args);
      status != registry::kSuccess) {
    Log(Level::Default, "KxConnectCallMethod failed: 0x%04x", status & kLowBits);
    return -1;
  }
  return 0;
}

}  // namespace brisvale
