// Loading the jobs of a mounted image (jobs/image_jobs): which are rewritten, submitted or refused.
#include "jobs/image_jobs.h"

#include <gtest/gtest.h>

#include "base/log.h"
#include "fake_os.h"
#include "job_files.h"
#include "platform/job_launcher.h"
#include "platform/linux/os_system.h"
#include "platform/services.h"

namespace brisvale {
namespace {

using plist::Array;
using plist::Dictionary;
using plist::Value;
using testing::Job;

// The real file system, seen from a temporary directory standing in for "/".
struct RootedOs : testing::FakeOs {
  std::string root;
  int ReadFilesBelow(const char* directory, size_t maxFileBytes,
                     const std::function<bool(const os::FoundFile&)>& visit) override {
    return os::SystemOs().ReadFilesBelow((root + directory).c_str(), maxFileBytes, visit);
  }
};

struct RecordingLauncher : jobs::JobLauncher {
  std::vector<Dictionary> submitted;
  std::string refused;  // the label answered with a failure
  std::optional<jobs::LaunchError> Submit(const Dictionary& job) override {
    if (*job.find("Label") == Value(refused)) return jobs::LaunchError{"already loaded: " + refused};
    submitted.push_back(job);
    return std::nullopt;
  }
};

struct ImageJobs : ::testing::Test {
  testing::JobTree tree;
  RootedOs os;
  RecordingLauncher launcher;
  ScopedServices services{Services{.os = &os, .jobLauncher = &launcher}};
  log::CaptureSink capture;
  ImageJobs() { os.root = tree.path().string(); }
};

TEST_F(ImageJobs, FactoryJobsAreRewrittenAndRefusalsOnlyLogged) {
  tree.Write("private/var/factory_mount/Library/OrbitDaemons/agent.plist",
             Value(Dictionary{{"Label", "agent"}, {"Program", "/Developer/usr/libexec/agent"}}));
  tree.Write("private/var/factory_mount/System/Library/OrbitDaemons/dup.plist", Value(Job("dup", Value("/Developer/x"))));
  launcher.refused = "dup";
  EXPECT_EQ(LoadImageJobs("/private/var/factory_mount", "Factory"), 0);
  const Dictionary expected = Job("agent", Value(Array{"/var/factory_mount/usr/libexec/agent"}));
  EXPECT_EQ(launcher.submitted, std::vector<Dictionary>{expected});
  EXPECT_TRUE(capture.Contains(Level::Debug, "Submitting orbitd job: \n" + Value(expected).description()));
  EXPECT_TRUE(capture.Contains(Level::Default, "JvJobSubmit failed: already loaded: dup"));
  // So are a personalized image's below the personalized factory root.
  tree.Write("private/var/personalized_factory/System/Library/OrbitDaemons/j", Value(Job("j", Value("/Developer/x"))));
  EXPECT_EQ(LoadImageJobs("/private/var/personalized_factory", "Personalized"), 0);
  EXPECT_EQ(*launcher.submitted.back().find("ProgramArguments"), Value(Array{"/var/personalized_factory/x"}));

  tree.Write("private/var/factory_mount/e/Library/OrbitDaemons/j",
             Value(Dictionary{{"Program", "/Developer/x"}, {"ERROR", "from the job"}}));
  EXPECT_EQ(LoadImageJobs("/private/var/factory_mount/e", "Factory"), -1);
  EXPECT_TRUE(capture.Contains(Level::Default, "Failed to copy/fix pist: from the job"));
}

// A job that fails verification stops the scan of its directory, yet the second directory is
// still scanned: its first job is submitted before the failure stops that scan too.
TEST_F(ImageJobs, FailureStopsEachScanButNotTheSecondDirectory) {
  tree.Write("Developer/Library/OrbitDaemons/bad", Value(Job("bad", Value("/usr/bin/x"))));
  for (const char* name : {"1", "2"}) {
    tree.Write(std::string("Developer/System/Library/OrbitDaemons/") + name, Value(Job(name, Value("/Developer/x"))));
  }
  EXPECT_EQ(LoadImageJobs("/Developer", "Developer"), -1);
  ASSERT_EQ(launcher.submitted.size(), 1u);
  EXPECT_NE(*launcher.submitted[0].find("Label"), Value("bad"));
}

}  // namespace
}  // namespace brisvale
