// Hands job descriptions to the service launcher, which starts and keeps the programs
// they describe. A job is a property-list dictionary in the launcher's job format; its
// "Label" names it, and no two loaded jobs share a label.
#pragma once

#include <optional>
#include <string>

#include "base/plist.h"

namespace brisvale::jobs {

// Why the launcher refused a job. The description says which failure it was and is
// what "%@" prints for it.
struct LaunchError {
  std::string description;
};

class JobLauncher {
 public:
  virtual ~JobLauncher() = default;
  // Submits `job`; none on success. Nothing is kept of a refused job.
  virtual std::optional<LaunchError> Submit(const plist::Dictionary& job) = 0;
};

}  // namespace brisvale::jobs
