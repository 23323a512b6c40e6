#include "media/mass_storage_mount.h"

namespace brisvale {

std::optional<std::string> MountMassStorageDevice(std::string_view, bool, bool& verificationFailed,
                                                  bool& mountFailed) {
  verificationFailed = false;
  mountFailed = false;
  return std::nullopt;
}

void HandleMassStorageMount(const plist::Value&, plist::Dictionary&) {}

}  // namespace brisvale
