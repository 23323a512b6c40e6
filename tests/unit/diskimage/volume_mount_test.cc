// Image volume mount, text-encoding choice and system version check over a fake
// operating system: the arguments the mount gets, the exact lines, what is undone.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "diskimage/volume_mount.h"
#include "disk_image_fixture.h"

namespace brisvale {
namespace {

using ::testing::ElementsAre;

std::vector<uint8_t> MasterDirectoryBlock(const char* signature, const char* embedded,
                                          std::vector<uint8_t> hint) {
  std::vector<uint8_t> block(512);
  std::copy_n(signature, 2, block.begin());
  std::copy_n(embedded, 2, block.begin() + 124);
  std::copy(hint.begin(), hint.end(), block.begin() + 108);
  return block;
}

TEST(TextEncodingTest, ChoiceFromTheBlockTheBiasAndTheUserFile) {
  const std::vector<uint8_t> hintUkrainian = {'e', 'n', 'c', 152}, hint200 = {'e', 'n', 'c', 200},
                             noHint = {'x', 'n', 'c', 1};
  std::vector<uint8_t> shortBlock = MasterDirectoryBlock("BD", "H+", hintUkrainian);
  shortBlock.pop_back();
  struct Case {
    const char* name;
    std::vector<uint8_t> block;
    int32_t bias;
    std::optional<std::string> userFile;
    uint32_t expected;
  } cases[] = {
      {"HFS without HFS+", MasterDirectoryBlock("BD", "\0\0", hintUkrainian), 5, "1", kNoTextEncoding},
      {"short block", shortBlock, 5, "1", kNoTextEncoding},
      {"hint of the last row", MasterDirectoryBlock("BD", "H+", hintUkrainian), 5, "2", 152},
      {"hint outside the table", MasterDirectoryBlock("BD", "H+", hint200), 5, "2", 0},
      {"bias", MasterDirectoryBlock("BD", "H+", noHint), 35, "2", 35},
      {"bias 0, user file in hex", MasterDirectoryBlock("BD", "H+", noHint), 0, "0x1D:0\n", 29},
      {"bias unknown, no user file", MasterDirectoryBlock("BD", "H+", noHint), -1, std::nullopt, 0},
  };
  for (const Case& c : cases) {
    const TextEncodingSources sources{[&] { return c.bias; }, [&] { return c.userFile; }};
    EXPECT_EQ(ChooseTextEncoding(c.block, sources), c.expected) << c.name;
  }
}

struct VolumeMountTest : testing::DiskImageTest {
  VolumeMountTest() { SetVersion("", "21.4.5"); }
  void SetVersion(const std::string& mountPath, const std::string& version) {
    os.contents[mountPath + std::string(kSystemVersionPath)] =
        "<plist version=\"1.0\"><dict><key>ProductVersion</key><string>" + version + "</string></dict></plist>";
  }
};

TEST_F(VolumeMountTest, VersionComparison) {
  const std::string imageMissing = "Failed to retrieve disk image product version from "
                                   "/System/Library/Basalt/SystemVersion.plist.";
  struct Case {
    const char* image;  // "": no version file on the image
    const char* system;
    bool matches;
    std::vector<std::string> lines;
  } cases[] = {
      {"21.4.1", "21.4.5", true, {"Disk Image Product Version: 21.4", "System Product Version: 21.4"}},
      {"21.04", "21.4.5", false,
       {"Disk Image Product Version: 21.04", "System Product Version: 21.4",
        "System Version Mismatch for /Developer: (System: 21.4 / Image: 21.04)"}},
      {"", "21.4.5", false, {imageMissing}},
      {"21.4", "21", false,
       {"Disk Image Product Version: 21.4",
        "Failed to retrieve system product version from /System/Library/Basalt/SystemVersion.plist."}},
  };
  for (const Case& c : cases) {
    capture.Clear();
    os.contents.clear();
    if (*c.image) SetVersion("/Developer", c.image);
    SetVersion("", c.system);
    EXPECT_EQ(VerifySystemVersion("/Developer"), c.matches) << c.image;
    EXPECT_EQ(capture.Texts(), c.lines) << c.image;
  }
}

TEST_F(VolumeMountTest, MountArgumentsFailuresAndTheUndoOfAMismatch) {
  const auto block = MasterDirectoryBlock("BD", "H+", {'e', 'n', 'c', 1});
  os.volumeHeaders["/dev/loop3"] = std::vector<uint8_t>(1024);
  os.volumeHeaders["/dev/loop3"].insert(os.volumeHeaders["/dev/loop3"].end(), block.begin(), block.end());
  SetVersion("/Developer", "21.4.1");
  EXPECT_EQ(MountImageVolume("loop3", "/Developer"), "/dev/loop3");
  EXPECT_EQ(os.mountFlags, os::kMountReadOnly);
  EXPECT_EQ(os.mountArguments.textEncoding, 1u);
  // "/" is a union mount (its version file read as "//System/..."); an unreadable block
  // chooses no encoding; personalized roots skip the check.
  SetVersion("/", "21.4");
  EXPECT_EQ(MountImageVolume("loop4", "/"), "/dev/loop4");
  EXPECT_EQ(os.mountFlags, os::kMountReadOnly | os::kMountUnion);
  EXPECT_EQ(os.mountArguments.textEncoding, kNoTextEncoding);
  EXPECT_EQ(MountImageVolume("loop4", "/private/var/personalized_debug"), "/dev/loop4");
  EXPECT_THAT(os.calls, ElementsAre("mount hfs /dev/loop3 /Developer", "mount hfs /dev/loop4 /",
                                    "mount hfs /dev/loop4 /private/var/personalized_debug"));

  capture.Clear();
  os.calls.clear();
  EXPECT_EQ(MountImageVolume("", "/Developer"), std::nullopt);
  EXPECT_EQ(MountImageVolume(std::string(1100, 'a'), "/Developer"), std::nullopt);
  os.mountResult = -EINVAL;
  EXPECT_EQ(MountImageVolume("loop3", "/Developer"), std::nullopt);  // left attached
  os.mountResult = 0;
  SetVersion("/Developer", "21.3");
  EXPECT_EQ(MountImageVolume("loop3", "/Developer"), std::nullopt);
  EXPECT_THAT(capture.Texts(),
              ElementsAre("Invalid inputs.", "Failed to create string.", "Failed to mount /dev/loop3 on /Developer: 22",
                          "Disk Image Product Version: 21.3", "System Product Version: 21.4",
                          "System Version Mismatch for /Developer: (System: 21.4 / Image: 21.3)",
                          "System version verification failed for /Developer."));
  EXPECT_THAT(os.calls, ElementsAre("mount hfs /dev/loop3 /Developer", "mount hfs /dev/loop3 /Developer",
                                    "force-unmount /Developer", "open /dev/loop3", "eject"));
}

}  // namespace
}  // namespace brisvale
