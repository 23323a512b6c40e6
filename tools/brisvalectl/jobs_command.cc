#include "jobs_command.h"

#include <algorithm>
#include <cstdio>
#include <vector>

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

// The image a job came from, when the job says.
std::string ImageOf(const plist::Dictionary& job) {
  const plist::Value* image = job.find("DiskImagePath");
  return image && image->string() ? *image->string() : "-";
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
      if (const plist::Value* image = job.find("DiskImagePath")) row.set("image", *image);
      row.set("job", plist::Value(job));
      list.push_back(plist::Value(std::move(row)));
    }
    std::printf("%s\n", ToJson(plist::Value(std::move(list))).c_str());
    return 0;
  }
  std::vector<std::vector<std::string>> rows{{"LABEL", "PROGRAM", "IMAGE"}};
  for (const auto& [label, job] : *jobs) rows.push_back({label, ProgramOf(job), ImageOf(job)});
  std::vector<size_t> widths(3, 0);
  for (const auto& row : rows) {
    for (size_t i = 0; i < row.size(); ++i) widths[i] = std::max(widths[i], row[i].size());
  }
  for (const auto& row : rows) {
    std::printf("%-*s  %-*s  %s\n", static_cast<int>(widths[0]), row[0].c_str(),
                static_cast<int>(widths[1]), row[1].c_str(), row[2].c_str());
  }
  return 0;
}

}  // namespace brisvale::tools
