// The rules a job description from a mounted disk image must meet before it reaches the
// service launcher: its program must lie inside the image's allowed root, and on a
// factory mount point its nominal "/Developer" program path is rewritten to where the
// image really is. Also finds the job files below a directory.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "base/plist.h"

namespace brisvale {

// The largest job file read; anything bigger is passed over.
inline constexpr size_t kMaxJobFileBytes = 1 << 20;

class PlistProcessor {
 public:
  // The one instance of the process, made on first use.
  static PlistProcessor& sharedPlistProcessor();

  // Calls `block` with every property list whose root is a dictionary at any depth
  // below `directory`, hidden files included, in directory order; anything else is
  // skipped silently. `block` answers false to stop the whole scan. Links are never
  // followed and nothing outside `directory` is read.
  void scanPlists(std::string_view directory,
                  const std::function<bool(const plist::Dictionary&)>& block) const;

  // Whether the job's program lies under the root allowed for `mountPoint`. A missing
  // job or mount point is a rejection.
  bool verifyPlist(const plist::Dictionary* plist, std::optional<std::string_view> mountPoint) const;

  // The job to submit for `mountPoint`: the job itself away from the factory roots,
  // the rewritten copy on them, {"ERROR": "INVALID IMAGE"} for a program outside
  // "/Developer", none for a job without usable program arguments.
  std::optional<plist::Dictionary> copyAndFixPlist(const plist::Dictionary* plist,
                                                   std::optional<std::string_view> mountPoint) const;

 private:
  PlistProcessor() = default;
};

// "/private/var/..." becomes "/var/..."; any other path is returned as it is.
std::string NormalizePath(std::string_view path);

// "ProgramArguments" as an array (a single string becoming a one-element array), or
// "Program" the same way when "ProgramArguments" is absent; none otherwise.
std::optional<plist::Array> CopyProgramArguments(const plist::Dictionary* plist);

}  // namespace brisvale
