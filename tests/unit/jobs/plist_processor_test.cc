#include "jobs/plist_processor.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <fstream>
#include <set>

#include "base/log.h"
#include "job_files.h"
#include "platform/linux/os_system.h"
#include "platform/services.h"
#include "plist_printers.h"

namespace brisvale {
namespace {

using plist::Array;
using plist::Dictionary;
using plist::Value;
using testing::Job;
using Lines = std::vector<std::string>;

const PlistProcessor& Processor() { return PlistProcessor::sharedPlistProcessor(); }
Value Args(std::initializer_list<Value> args) { return Value(Array(args)); }

TEST(PlistProcessor, VerifiesTheProgramAgainstTheRootOfTheMountPoint) {
  const Value tool = Args({"/Developer/usr/bin/tool", "-x"});
  struct Case {
    const char* why;
    Dictionary job;
    std::optional<std::string_view> mountPoint;
    bool verifies;
    Lines logged;
  } cases[] = {
      {"developer image", Job("a", tool), "/Developer", true, {}},
      {"developer job on a personalized debug image", Job("a", tool),
       "/private/var/personalized_debug/x", false, {}},
      {"plain prefix test", Job("a", Args({"/DeveloperTools/x"})), "/Developer", true, {}},
      {"program normalized", Job("a", Args({"/var/personalized_demo/usr/bin/tool"})),
       "/private/var/personalized_demo", true, {}},
      {"both normalized", Job("a", Args({"/private/var/personalized_demo/usr/bin/tool"})),
       "/var/personalized_demo", true, {}},
      {"factory roots ask for /Developer", Job("a", Value("/Developer/bin/x")),
       "/private/var/personalized_factory/f", true, {}},
      {"factory root refuses its own path", Job("a", Args({"/private/var/factory_mount/x"})),
       "/private/var/factory_mount", false, {}},
      {"Program alone", Dictionary{{"Program", "/private/var/debug_mount/x"}},
       "/private/var/debug_mount", true, {}},
      {"mount point outside every root", Job("a", tool), "/mnt/usb", false, {}},
      {"number does not fall back to Program",
       Dictionary{{"ProgramArguments", Value::Int(7)}, {"Program", "/Developer/x"}}, "/Developer",
       false, {"Unexpected object: 7", "Failed to retrieve program arguments."}},
      {"empty arguments", Job("a", Args({})), "/Developer", false, {"Failed to normalize (null)."}},
      {"first argument not text", Job("a", Args({Value::Bool(true)})), "/Developer", false,
       {"Failed to normalize true."}},
      {"no mount point", Job("a", tool), std::nullopt, false, {"Invalid input."}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.why);
    log::CaptureSink capture;
    EXPECT_EQ(Processor().verifyPlist(&c.job, c.mountPoint), c.verifies);
    EXPECT_EQ(capture.Texts(), c.logged);
  }
}

TEST(PlistProcessor, RewritesFactoryJobsToTheRealMountPoint) {
  const Dictionary invalidImage{{"ERROR", "INVALID IMAGE"}};
  const Dictionary service{{"Label", "s"}, {"VexaServiceName", "com.x"}};
  const auto rewritten = [](Value args) {
    return Dictionary{{"Label", "a"}, {"ProgramArguments", std::move(args)}};
  };
  struct Case {
    const char* why;
    Dictionary job;
    std::string_view mountPoint;
    std::optional<Dictionary> result;
    Lines logged;
  } cases[] = {
      {"agent", Job("a", Args({"/Developer/usr/libexec/agent", "-v"})), "/private/var/factory_mount",
       rewritten(Args({"/var/factory_mount/usr/libexec/agent", "-v"})), {}},
      {"/Developer alone, Program dropped", Dictionary{{"Label", "a"}, {"Program", "/Developer"}},
       "/private/var/factory_mount", rewritten(Args({"/var/factory_mount"})), {}},
      {"any first component", Job("a", Value("/DeveloperTools/x")), "/var/factory_mount",
       rewritten(Args({"/var/factory_mount/x"})), {}},
      {"personalized factory", Job("a", Args({"/Developer/x"})), "/private/var/personalized_factory/p",
       rewritten(Args({"/var/personalized_factory/p/x"})), {}},
      {"not a factory mount point", Job("a", Args({"/usr/bin/x"})), "/Developer",
       Job("a", Args({"/usr/bin/x"})), {}},
      {"service job passes", service, "/private/var/factory_mount", service,
       {"Unexpected object: (null)", "Missing program arguments, likely a tethra plist."}},
      {"no program", Dictionary{{"Label", "a"}}, "/private/var/factory_mount", std::nullopt,
       {"Unexpected object: (null)", "Invalid program arguments"}},
      {"first argument not text", Job("a", Args({Value::Int(1), "/Developer/x"})),
       "/private/var/factory_mount", std::nullopt,
       {"Invalid program arguments: " + Args({Value::Int(1), "/Developer/x"}).description()}},
      {"program outside /Developer", Job("a", Args({"/usr/bin/x"})), "/private/var/factory_mount",
       invalidImage, {"Invalid program path: /usr/bin/x"}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.why);
    log::CaptureSink capture;
    EXPECT_EQ(Processor().copyAndFixPlist(&c.job, c.mountPoint), c.result);
    EXPECT_EQ(capture.Texts(), c.logged);
  }
  log::CaptureSink capture;
  EXPECT_EQ(Processor().copyAndFixPlist(nullptr, "/private/var/factory_mount"), std::nullopt);
  EXPECT_EQ(capture.Texts(), Lines{"invalid inputs"});
}

TEST(PlistProcessor, ScanFindsJobListsAtAnyDepthAndNothingElse) {
  testing::TempTree image, outside;
  outside.Write("escaped.plist", Value(Job("escaped", Args({"/x"}))));
  image.Write("jobs/a.plist", Value(Job("a", Args({"/x"}))), /*xml=*/true);
  image.Write("jobs/sub/.hidden", Value(Job("b", Args({"/x"}))));
  image.Write("jobs/array.plist", Args({"/x"}));
  std::ofstream(image.root / "jobs/notes.txt") << "not a property list";
  std::filesystem::create_directory_symlink(outside.root, image.root / "jobs/link");
  std::filesystem::create_symlink(outside.root / "escaped.plist", image.root / "jobs/file-link");
  ASSERT_EQ(::mkfifo((image.root / "jobs/fifo").c_str(), 0600), 0);
  std::filesystem::create_directory_symlink(image.root / "jobs", image.root / "jobs-link");

  ScopedServices services(Services{.os = &os::SystemOs()});
  const auto labels = [&](const std::string& directory, bool goOn) {
    std::multiset<std::string> seen;
    Processor().scanPlists((image.root / directory).string(), [&](const Dictionary& job) {
      seen.insert(*job.find("Label")->string());
      return goOn;
    });
    return seen;
  };
  EXPECT_EQ(labels("jobs", true), (std::multiset<std::string>{"a", "b"}));
  EXPECT_EQ(labels("jobs", false).size(), 1u);
  EXPECT_TRUE(labels("jobs-link", true).empty());
  EXPECT_TRUE(labels("missing", true).empty());
}

}  // namespace
}  // namespace brisvale
