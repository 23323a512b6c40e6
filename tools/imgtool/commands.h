// The imgtool commands; each takes its arguments after the command name and returns
// the exit status, throwing ToolError for bad input.
#pragma once

#include <string>
#include <vector>

namespace brisvale::imgtool {

int SignDeveloper(const std::vector<std::string>& args);
int BuildManifest(const std::vector<std::string>& args);
int WriteIdentity(const std::vector<std::string>& args);
int BuildTrustCache(const std::vector<std::string>& args);

}  // namespace brisvale::imgtool
