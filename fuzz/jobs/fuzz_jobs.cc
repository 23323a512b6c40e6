// Arbitrary bytes as the one job file of a mounted image, loaded as a developer and as a
// factory image: the scan, the verification and the rewrite never crash, and whatever
// reaches the launcher runs a program inside the image.
#include <cstdint>
#include <cstdlib>
#include <string>

#include "base/log.h"
#include "fake_os.h"
#include "jobs/image_jobs.h"
#include "jobs/plist_processor.h"
#include "platform/job_launcher.h"
#include "platform/services.h"

namespace {

using namespace brisvale;

struct OneJobFileOs : testing::FakeOs {
  std::span<const uint8_t> bytes;
  int ReadFilesBelow(const char*, size_t maxFileBytes,
                     const std::function<bool(const os::FoundFile&)>& visit) override {
    if (bytes.size() <= maxFileBytes) visit(os::FoundFile{"job.plist", bytes});
    return 0;
  }
};

struct NullSink : log::Sink {
  void Write(log::Level, std::string_view) override {}
};

// The program a submitted job runs, as the launcher would take it.
const std::string* ProgramOf(const plist::Dictionary& job) {
  const plist::Value* value = job.find("ProgramArguments");
  if (!value) value = job.find("Program");
  if (value && value->array() && !value->array()->empty()) value = &value->array()->front();
  return value ? value->string() : nullptr;
}

struct CheckingLauncher : jobs::JobLauncher {
  std::string programRoot;  // every submitted program must start with this
  bool rewritten = false;   // submitted jobs must carry rewritten arguments, no "Program"
  std::optional<jobs::LaunchError> Submit(const plist::Dictionary& job) override {
    const std::string* program = ProgramOf(job);
    if (!program || !NormalizePath(*program).starts_with(programRoot)) std::abort();
    if (rewritten && (job.find("Program") || !job.find("ProgramArguments")->array())) std::abort();
    return std::nullopt;
  }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static NullSink sink;
  log::SetSink(&sink);
  OneJobFileOs os;
  os.bytes = {data, size};
  CheckingLauncher launcher;
  ScopedServices services(Services{.os = &os, .jobLauncher = &launcher});

  launcher.programRoot = "/Developer";
  const int developer = LoadImageJobs("/Developer", "Developer");
  launcher.programRoot = "/var/factory_mount";
  launcher.rewritten = true;
  const int factory = LoadImageJobs("/private/var/factory_mount", "Factory");
  // Both roots ask for a "/Developer" program; the factory load can fail beyond that
  // only in the rewrite (a job carrying its own "ERROR" key, for one).
  if (factory == 0 && developer != 0) std::abort();
  return 0;
}
