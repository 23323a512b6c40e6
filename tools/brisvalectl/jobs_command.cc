#include "jobs_command.h"

#include <algorithm>
#include <cstdio>
#include <string_view>

#include "json.h"
#include "platform/linux/jobs_spool.h"

namespace brisvale::tools {
namespace {

// The program a job runs: the first program argument, else "Program".
std::string ProgramOf(const plist::Dictionary& job) {
  const plist::Value* value = job.find("ProgramArguments");
  if (!value) value = job.find("Program");
  if (value && value->array() && !value->array()->empty()) value = &value->array()->front();
  return value && value->string() ? *value->string() : "-";
}

}  // namespace

int ListJobs(const std::string& root, bool json) {
  std::string error;
  const auto jobs = brisvale::jobs::ReadJobSpool(root + brisvale::jobs::kJobSpoolDirectory, &error);
  if (!jobs) {
    std::fprintf(stderr, "brisvalectl: %s\n", error.c_str());
    return 1;
  }
  if (json) {
    plist::Array list;
    for (const auto& [label, job] : *jobs) {
      plist::Dictionary row{{"label", plist::Value(label)}, {"program", plist::Value(ProgramOf(job))}};
      row.set("job", plist::Value(job));
      list.push_back(plist::Value(std::move(row)));
    }
    std::printf("%s\n", ToJson(plist::Value(std::move(list))).c_str());
    return 0;
  }
  size_t labelWidth = std::string_view("LABEL").size();
  for (const auto& [label, job] : *jobs) labelWidth = std::max(labelWidth, label.size());
  std::printf("%-*s  %s\n", static_cast<int>(labelWidth), "LABEL", "PROGRAM");
  for (const auto& [label, job] : *jobs) {
    std::printf("%-*s  %s\n", static_cast<int>(labelWidth), label.c_str(), ProgramOf(job).c_str());
  }
  return 0;
}

}  // namespace brisvale::tools
