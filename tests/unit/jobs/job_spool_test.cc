// The job spool launcher (platform/linux/jobs_spool): labels refused, and no half-written job.
#include "platform/linux/jobs_spool.h"

#include <gtest/gtest.h>
#include <sys/resource.h>

#include <csignal>

#include "job_files.h"

namespace brisvale::jobs {
namespace {

using plist::Dictionary;
using plist::Value;

std::vector<std::string> Entries(const std::filesystem::path& directory) {
  std::vector<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(directory)) names.push_back(entry.path().filename());
  return names;
}

TEST(JobSpool, RefusesBadAndDuplicateLabelsWithoutWriting) {
  testing::JobTree tree;
  SpoolJobLauncher launcher((tree.path() / "jobs").string());
  const Dictionary loaded{{"Label", "com.x.agent"}, {"Program", "/bin/first"}};
  ASSERT_EQ(launcher.Submit(loaded), std::nullopt);
  const std::pair<std::optional<Value>, const char*> cases[] = {
      {std::nullopt, "the job has no Label"},
      {Value::Int(3), "the job's Label is not a string"},
      {Value(""), "the job's Label is empty"},
      {Value("a/b"), "the job's Label holds a \"/\""},
      {Value(std::string("a\0b", 3)), "the job's Label holds a NUL"},
      {Value(".."), "the job's Label is \".\" or \"..\""},
      {Value(std::string(256, 'x')), "the job's Label is longer than a file name may be"},
      {Value("com.x.agent"), "a job labelled \"com.x.agent\" is already loaded"},
  };
  for (const auto& [label, description] : cases) {
    Dictionary job{{"Program", "/bin/second"}};
    if (label) job.set("Label", *label);
    const std::optional<LaunchError> error = launcher.Submit(job);
    EXPECT_EQ(error ? error->description : "submitted", description);
  }
  const auto spooled = ReadJobSpool((tree.path() / "jobs").string(), nullptr);
  ASSERT_TRUE(spooled && spooled->size() == 1);
  EXPECT_EQ(spooled->front().job, loaded);
  EXPECT_EQ(Entries(tree.path() / "jobs"), std::vector<std::string>{"com.x.agent"});
}

// A write that stops part-way (here at the file-size limit) must leave nothing a reader
// could take for the job.
TEST(JobSpool, HalfWrittenJobNeverShows) {
  testing::JobTree tree;
  SpoolJobLauncher launcher((tree.path() / "jobs").string());
  const Dictionary big{{"Label", "big"}, {"Data", Value(plist::Bytes(64 << 10, 1))}};
  rlimit saved;
  ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &saved), 0);
  const auto previousHandler = std::signal(SIGXFSZ, SIG_IGN);
  rlimit small = saved;
  small.rlim_cur = 4096;
  ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &small), 0);
  const std::optional<LaunchError> error = launcher.Submit(big);
  ::setrlimit(RLIMIT_FSIZE, &saved);
  std::signal(SIGXFSZ, previousHandler);

  ASSERT_TRUE(error);
  EXPECT_EQ(error->description, "cannot write the job file: File too large");
  EXPECT_TRUE(Entries(tree.path() / "jobs").empty());
  EXPECT_EQ(launcher.Submit(big), std::nullopt);
}

}  // namespace
}  // namespace brisvale::jobs
