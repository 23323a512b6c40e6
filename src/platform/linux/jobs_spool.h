// The service launcher's job spool: a directory holding one binary property list per
// loaded job, named by the job's "Label". The launcher picks jobs up from there; the
// spool is also what `brisvalectl jobs` lists.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "base/plist.h"
#include "platform/job_launcher.h"

namespace brisvale::jobs {

inline constexpr const char* kJobSpoolDirectory = "/var/run/orbitd/jobs";

// Why `job` cannot be spooled under its "Label", or none when the label can name a
// file of the spool.
std::optional<LaunchError> CheckJobLabel(const plist::Dictionary& job);

class SpoolJobLauncher final : public JobLauncher {
 public:
  // `directory` is created (with its parents) on the first submission.
  explicit SpoolJobLauncher(std::string directory = kJobSpoolDirectory)
      : directory_(std::move(directory)) {}

  // Writes the job in full under a temporary name and only then gives it its label,
  // refusing to replace a job already there, so a reader never sees half a job and a
  // label is loaded at most once.
  std::optional<LaunchError> Submit(const plist::Dictionary& job) override;

 private:
  std::string directory_;
};

struct SpooledJob {
  std::string label;
  plist::Dictionary job;
};

// The jobs in the spool at `directory`, in label order: files whose content is a
// dictionary labelled with the file's own name (which leaves out submissions still
// being written). A missing spool is empty; none with `error` set when it cannot be
// read.
std::optional<std::vector<SpooledJob>> ReadJobSpool(const std::string& directory, std::string* error);

}  // namespace brisvale::jobs
