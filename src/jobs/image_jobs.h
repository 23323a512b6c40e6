// Loading the background services a freshly mounted disk image brings: every job
// description in the image's two job directories is checked against the place the
// image is mounted, rewritten for factory images, and handed to the service launcher.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "base/plist.h"

namespace brisvale {

// The job directories below a mount path, scanned in this order.
inline constexpr const char* kImageJobDirectories[] = {"/Library/OrbitDaemons",
                                                      "/System/Library/OrbitDaemons"};

// Shared by every job of one image mount, across both directories.
struct ImageJobLoadState {
  std::string mountPoint;
  std::string diskImageType;  // "Developer", "Personalized", "Factory"
  // 0 until the first job fails verification or rewriting, -1 from then on; a later
  // success never resets it.
  int32_t loadStatus = 0;
};

// Checks, rewrites where the image type asks for it, and submits one job through the
// installed JobLauncher. Answers whether the scan should go on. A job the launcher
// refuses is logged and does not change the load status.
bool SubmitImageJob(ImageJobLoadState& loadState, const plist::Dictionary& job);

// Scans both job directories below `mountPoint` and submits what they hold. Returns 0,
// or -1 when a job failed verification or rewriting (jobs submitted before that stay
// submitted). An image without job directories loads nothing and returns 0.
int LoadImageJobs(std::string_view mountPoint, std::string_view diskImageType);

}  // namespace brisvale
