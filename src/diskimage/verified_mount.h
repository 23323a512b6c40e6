// The verified mount pipeline: a client's image file is checked, digested, verified
// against its signature or personalized manifest, attached, mounted and its trust cache
// loaded; the file is consumed (unlinked) by every attempt that gets as far as looking
// at it.
#pragma once

#include <functional>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "base/plist.h"
#include "daemon/matching_context.h"
#include "diskimage/attach.h"

namespace brisvale {

struct VerifiedMountRequest {
  std::string_view imagePath;
  std::string_view diskImageType;
  std::span<const uint8_t> imageSignature;
  std::optional<std::string_view> certificatePath;
  std::string_view mountPath;
};

struct VerifiedMountResult {
  std::optional<std::string> deviceNode;         // a new mount's device node
  std::optional<std::string> existingMountPath;  // an identical image already mounted there
  std::optional<plist::Bytes> imageDigest;       // once the file has been digested
};

// The signature check and the steps after it, replaceable so the undo paths can be
// exercised without a device's keys or a driver.
struct MountSteps {
  // 0 when the request's signature or manifest vouches for `digest`.
  std::function<int(const VerifiedMountRequest& request, std::span<const uint8_t> digest)>
      checkSignature;
  std::function<std::optional<std::string>(std::string_view imagePath, std::string_view mountPath,
                                           const VerifiedFile& verified)>
      attachAndMount;
  std::function<int(std::string_view mountPath)> loadTrustCache;
};
MountSteps DefaultMountSteps();

VerifiedMountResult MountVerifiedImage(MatchingContext& context, const VerifiedMountRequest& request,
                                       const MountSteps& steps = DefaultMountSteps());

}  // namespace brisvale
