// `brisvalectl jobs`: the jobs loaded into the service launcher's spool.
#pragma once

#include <string>

namespace brisvale::tools {

// Lists the spool below the sandbox `root` ("" for the real one) as a table or, with
// `json`, as a JSON array. Returns the exit status.
int ListJobs(const std::string& root, bool json);

}  // namespace brisvale::tools
