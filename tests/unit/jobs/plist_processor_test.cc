// Job property lists (jobs/plist_processor): program verification, factory rewrite and the scan.
#include "jobs/plist_processor.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <set>

#include "base/log.h"
#include "job_files.h"
#include "platform/linux/os_system.h"
#include "platform/services.h"

namespace brisvale {
namespace {

using plist::Dictionary;
using plist::Value;
using testing::Job;
using Lines = std::vector<std::string>;

const PlistProcessor& Processor() { return PlistProcessor::sharedPlistProcessor(); }
Value Args(std::initializer_list<Value> args) { return Value(plist::Array(args)); }

TEST(PlistProcessor, VerifiesTheProgramAgainstTheRootOfTheMountPoint) {
  const Value tool = Args({"/Developer/usr/bin/tool", "-x"});
  struct Case {
    Dictionary job;
    std::optional<std::string_view> mountPoint;
    bool verifies;
    Lines logged;
  } cases[] = {
      {Job("a", tool), "/Developer", true, {}},
      {Job("a", Args({"/DeveloperTools/x"})), "/Developer", true, {}},  // plain prefix test
      {Job("a", Args({"/private/var/personalized_demo/usr/bin/tool"})), "/var/personalized_demo", true, {}},
      {Job("a", Args({"/private/var/factory_mount/x"})), "/private/var/factory_mount", false, {}},
      {Job("a", tool), "/mnt/usb", false, {}},
      {Dictionary{{"ProgramArguments", Value::Int(7)}, {"Program", "/Developer/x"}}, "/Developer", false,
       {"Unexpected object: 7", "Failed to retrieve program arguments."}},
      {Job("a", Args({})), "/Developer", false, {"Failed to normalize (null)."}},
      {Job("a", Args({Value::Bool(true)})), "/Developer", false, {"Failed to normalize true."}},
      {Job("a", tool), std::nullopt, false, {"Invalid input."}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(Value(c.job).description() + " on " + std::string(c.mountPoint.value_or("(null)")));
    log::CaptureSink capture;
    EXPECT_EQ(Processor().verifyPlist(&c.job, c.mountPoint), c.verifies);
    EXPECT_EQ(capture.Texts(), c.logged);
  }
}

TEST(PlistProcessor, RewritesFactoryJobsToTheRealMountPoint) {
  const Dictionary service{{"Label", "s"}, {"VexaServiceName", "com.x"}};
  const char* factory = "/private/var/factory_mount";
  struct Case {
    Dictionary job;
    std::string_view mountPoint;
    std::optional<Dictionary> result;
    Lines logged;
  } cases[] = {
      {Job("a", Args({"/Developer/usr/libexec/agent", "-v"})), factory,
       Job("a", Args({"/var/factory_mount/usr/libexec/agent", "-v"})), {}},
      {Job("a", Value("/DeveloperTools/x")), "/var/factory_mount", Job("a", Args({"/var/factory_mount/x"})), {}},
      {service, factory, service, {"Unexpected object: (null)", "Missing program arguments, likely a tethra plist."}},
      {Dictionary{{"Label", "a"}}, factory, std::nullopt, {"Unexpected object: (null)", "Invalid program arguments"}},
      {Job("a", Args({Value::Int(1)})), factory, std::nullopt,
       {"Invalid program arguments: " + Args({Value::Int(1)}).description()}},
      {Job("a", Args({"/usr/bin/x"})), factory, Dictionary{{"ERROR", "INVALID IMAGE"}},
       {"Invalid program path: /usr/bin/x"}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(Value(c.job).description() + " on " + std::string(c.mountPoint));
    log::CaptureSink capture;
    EXPECT_EQ(Processor().copyAndFixPlist(&c.job, c.mountPoint), c.result);
    EXPECT_EQ(capture.Texts(), c.logged);
  }
  log::CaptureSink capture;
  EXPECT_EQ(Processor().copyAndFixPlist(nullptr, factory), std::nullopt);
  EXPECT_EQ(capture.Texts(), Lines{"invalid inputs"});
}

TEST(PlistProcessor, ScanFindsJobListsAtAnyDepthAndNothingElse) {
  testing::JobTree image, outside;
  outside.Write("escaped.plist", Value(Job("escaped", Args({"/x"}))));
  image.Write("jobs/a.plist", Value(Job("a", Args({"/x"}))), /*xml=*/true);
  image.Write("jobs/sub/.hidden", Value(Job("b", Args({"/x"}))));
  image.Write("jobs/array.plist", Args({"/x"}));
  std::ofstream(image.path() / "jobs/notes.txt") << "plain text";
  std::filesystem::create_directory_symlink(outside.path(), image.path() / "jobs/link");
  std::filesystem::create_symlink(outside.path() / "escaped.plist", image.path() / "jobs/file-link");
  ASSERT_EQ(::mkfifo((image.path() / "jobs/fifo").c_str(), 0600), 0);
  std::filesystem::create_directory_symlink(image.path() / "jobs", image.path() / "jobs-link");

  ScopedServices services(Services{.os = &os::SystemOs()});
  const auto labels = [&](const char* directory, bool goOn) {
    std::multiset<std::string> seen;
    Processor().scanPlists((image.path() / directory).string(), [&](const Dictionary& job) {
      seen.insert(*job.find("Label")->string());
      return goOn;
    });
    return seen;
  };
  EXPECT_EQ(labels("jobs", true), (std::multiset<std::string>{"a", "b"}));
  EXPECT_EQ(labels("jobs", false).size(), 1u);
  EXPECT_TRUE(labels("jobs-link", true).empty());  // a link on the way is not followed either
  EXPECT_TRUE(labels("missing", true).empty());
}

}  // namespace
}  // namespace brisvale
