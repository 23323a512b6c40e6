// "Mount" / "MassStorage" against the real daemon in a sandbox root, with simulated
// sticks and the check and mount tool doubles.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "media_doubles.h"
#include "plist_printers.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

plist::Value Stick(const std::string& bsdName) {
  plist::Dictionary media{{"BSD Name", plist::Value(bsdName)}, {"Content", ""},
                          {"Removable", plist::Value::Bool(true)}, {"Leaf", plist::Value::Bool(true)},
                          {"Writable", plist::Value::Bool(true)}};
  return plist::Dictionary{{"Name", plist::Value("stick-" + bsdName)}, {"Class", "KxMedia"},
                           {"Properties", plist::Value(std::move(media))}};
}

// The options of what is mounted at `path` (as seen from outside), or "" when nothing is.
std::string MountOptions(const std::string& path, const std::string& source) {
  std::ifstream table("/proc/self/mounts");
  std::string from, on, type, options, rest;
  std::string found;
  while (table >> from >> on >> type >> options && std::getline(table, rest)) {
    if (on == path && from == source) found = type + " " + options;
  }
  return found;
}

TEST(MassStorageMountTest, MountsByVolumeKindWithCheckerVerdicts) {
  BRISVALE_REQUIRE_ROOT();
  struct Case {
    std::string bsdName, kind, marker;
    bool readOnly;
    std::string mountPath;  // empty: the request fails
    std::string line;
  };
  const Case cases[] = {
      {"sdb1", "hfs+", "", false, "/private/var/mnt/mount1", "default: Successfully mounted /var/mnt/mount1."},
      {"sdc1", "hfsx", "dirty", true, "/private/var/mnt/mount2",
       "debug: The filesystem at /dev/sdc1 appears to be dirty."},
      {"sdd1", "hfs+", "broken", false, "", "default: Failed to mount /dev/sdd1: verification issues"},
      {"sde1", "ntfs", "", false, "", "default: Failed to mount /dev/sde1."},
      {"sdf1", "fat", "", false, "/dev/sdf1", "debug: MSDOS FAT filesystem at /dev/sdf1. Skipping mount."},
      // A FIFO where the node should be must not block the daemon.
      {"sdh1", "fifo", "", false, "", "default: Failed to read /dev/sdh1 volume header: 29"},
  };
  SandboxDaemon daemon;
  plist::Array sticks;
  for (const Case& c : cases) {
    ASSERT_TRUE(c.kind == "fifo" ? mkfifo(daemon.Path("/dev/" + c.bsdName).c_str(), 0600) == 0
                                 : PlaceVolume(daemon, c.bsdName, c.kind, c.marker));
    sticks.push_back(Stick(c.bsdName));
  }
  ASSERT_TRUE(PlaceVolume(daemon, "sdg1", "hfs+"));
  sticks.push_back(Stick("sdg1"));
  std::ofstream(daemon.Path("/devices.plist"))
      << plist::WriteXml(plist::Dictionary{{"Objects", plist::Value(std::move(sticks))}});
  ASSERT_TRUE(InstallToolDoubles(daemon));
  ASSERT_TRUE(daemon.Start({"--devices", "/devices.plist"}));

  for (const Case& c : cases) {
    SCOPED_TRACE(c.bsdName);
    std::optional<plist::Value> reply;
    plist::Dictionary request{{"RequestType", "Mount"}, {"DeviceType", "MassStorage"},
                              {"DeviceNode", plist::Value("/dev/" + c.bsdName)}};
    if (c.readOnly) request.set("MountReadOnly", plist::Value::Bool(true));
    ASSERT_TRUE(daemon.SendRequest(request, &reply).ok());
    EXPECT_EQ(*reply->getString("Status"), c.mountPath.empty() ? "Failure" : "Success");
    EXPECT_EQ(reply->getString("MountPath") ? *reply->getString("MountPath") : "", c.mountPath);
    EXPECT_TRUE(daemon.LogContains(c.line));
    if (c.mountPath.starts_with("/private/var/mnt/")) {
      const std::string options = MountOptions(daemon.Path(c.mountPath), "/dev/" + c.bsdName);
      EXPECT_THAT(options, ::testing::StartsWith(c.readOnly ? "tmpfs ro," : "tmpfs rw,"));
      EXPECT_THAT(options, ::testing::HasSubstr("nosuid,nodev"));
    }
  }
  // Only a passing volume reaches the mount tool: the failures left no mount point behind.
  EXPECT_FALSE(std::filesystem::exists(daemon.Path("/private/var/mnt/mount3")));

  // The client command prints the mount path.
  std::string output;
  EXPECT_EQ(RunProgram({BRISVALE_CTL_PATH, "--root", daemon.root(), "mount-storage", "/dev/sdg1", "--read-only"},
                       &output), 0);
  EXPECT_EQ(output, "/private/var/mnt/mount3\n");
  EXPECT_THAT(MountOptions(daemon.Path("/private/var/mnt/mount3"), "/dev/sdg1"), ::testing::StartsWith("tmpfs ro,"));
}

}  // namespace
}  // namespace brisvale::testing
