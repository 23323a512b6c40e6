#include "jobs/image_jobs.h"

#include <optional>

#include "base/log.h"
#include "jobs/plist_processor.h"
#include "platform/job_launcher.h"
#include "platform/os.h"
#include "platform/services.h"

namespace brisvale {
namespace {

constexpr std::string_view kPersonalizedFactoryRoot = "/private/var/personalized_factory";

// Factory images name their programs by the nominal "/Developer" path; so do
// personalized images mounted under the personalized factory root (tested on the
// mount point as written, without normalization).
bool RewriteApplies(const ImageJobLoadState& state) {
  return state.diskImageType == "Factory" ||
         (state.diskImageType == "Personalized" &&
          std::string_view(state.mountPoint).starts_with(kPersonalizedFactoryRoot));
}

std::optional<jobs::LaunchError> Submit(const plist::Dictionary& job) {
  jobs::JobLauncher* launcher = CurrentServices().jobLauncher;
  if (!launcher) return jobs::LaunchError{"no job launcher is installed"};
  return launcher->Submit(job);
}

// The directory the job directories are looked up below. The mount point is the
// daemon's own, so links on the way to it (such as /var) are resolved here; below it
// the scan follows no link at all.
std::string ScanBase(const std::string& mountPoint) {
  os::Os* os = CurrentServices().os;
  std::string resolved;
  if (os && os->RealPath(mountPoint.c_str(), resolved) == 0) return resolved;
  return mountPoint;
}

}  // namespace

bool SubmitImageJob(ImageJobLoadState& loadState, const plist::Dictionary& job) {
  const PlistProcessor& processor = PlistProcessor::sharedPlistProcessor();
  if (!processor.verifyPlist(&job, loadState.mountPoint)) {
    loadState.loadStatus = -1;
    return false;
  }
  std::optional<plist::Dictionary> submitted;
  if (RewriteApplies(loadState)) {
    submitted = processor.copyAndFixPlist(&job, loadState.mountPoint);
    const plist::Value* error = submitted ? submitted->find("ERROR") : nullptr;
    if (!submitted || error) {
      Log(Level::Default, "Failed to copy/fix pist: %@", error);
      loadState.loadStatus = -1;
      return false;
    }
  } else {
    submitted = job;
  }
  Log(Level::Debug, "Submitting orbitd job: \n%@", plist::Value(*submitted));
  if (const std::optional<jobs::LaunchError> error = Submit(*submitted)) {
    Log(Level::Default, "JvJobSubmit failed: %@", error->description);
  }
  return loadState.loadStatus == 0;
}

int LoadImageJobs(std::string_view mountPoint, std::string_view diskImageType) {
  ImageJobLoadState state{std::string(mountPoint), std::string(diskImageType), 0};
  const std::string base = ScanBase(state.mountPoint);
  const PlistProcessor& processor = PlistProcessor::sharedPlistProcessor();
  // The second directory is scanned even after the first one failed; its first job is
  // still checked and submitted before the failure stops that scan too.
  for (const char* suffix : kImageJobDirectories) {
    processor.scanPlists(base + suffix, [&](const plist::Dictionary& job) {
      return SubmitImageJob(state, job);
    });
  }
  return state.loadStatus;
}

}  // namespace brisvale
