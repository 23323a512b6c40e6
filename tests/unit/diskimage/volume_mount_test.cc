// Image volume mount, text-encoding choice and system version check over a fake
// operating system: the arguments the mount gets, the exact lines, what is undone.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>

#include "base/log.h"
#include "diskimage/volume_mount.h"
#include "fake_os.h"
#include "platform/services.h"

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
  const std::vector<uint8_t> hint1 = {'e', 'n', 'c', 1}, hint200 = {'e', 'n', 'c', 200},
                             hintUkrainian = {'e', 'n', 'c', 152}, noHint = {'x', 'n', 'c', 1};
  std::vector<uint8_t> shortBlock = MasterDirectoryBlock("BD", "H+", hint1);
  shortBlock.pop_back();
  struct Case {
    const char* name;
    std::vector<uint8_t> block;
    int32_t bias;
    std::optional<std::string> userFile;
    uint32_t expected;
    bool asksBias, asksUserFile;
  } cases[] = {
      {"plain HFS+", MasterDirectoryBlock("H+", "\0\0", noHint), 5, "1", kNoTextEncoding, false, false},
      {"HFS without HFS+", MasterDirectoryBlock("BD", "\0\0", hint1), 5, "1", kNoTextEncoding, false, false},
      {"short block", shortBlock, 5, "1", kNoTextEncoding, false, false},
      {"hint", MasterDirectoryBlock("BD", "H+", hint1), 5, "2", 1, false, false},
      {"hint of the last row", MasterDirectoryBlock("BD", "H+", hintUkrainian), 5, "2", 152, false, false},
      {"hint outside the table", MasterDirectoryBlock("BD", "H+", hint200), 5, "2", 0, false, false},
      {"bias", MasterDirectoryBlock("BD", "H+", noHint), 35, "2", 35, true, false},
      {"bias outside the table", MasterDirectoryBlock("BD", "H+", noHint), 99, "2", 0, true, false},
      {"bias 0, user file in hex", MasterDirectoryBlock("BD", "H+", noHint), 0, "0x1D:0\n", 29, true, true},
      {"bias unknown, no user file", MasterDirectoryBlock("BD", "H+", noHint), -1, std::nullopt, 0, true, true},
      {"bias unknown, user file garbage", MasterDirectoryBlock("BD", "H+", noHint), -1, "Roman", 0, true, true},
  };
  for (const Case& c : cases) {
    bool askedBias = false, askedUserFile = false;
    const TextEncodingSources sources{[&] { askedBias = true; return c.bias; },
                                      [&] { askedUserFile = true; return c.userFile; }};
    EXPECT_EQ(ChooseTextEncoding(c.block, sources), c.expected) << c.name;
    EXPECT_EQ(askedBias, c.asksBias) << c.name;
    EXPECT_EQ(askedUserFile, c.asksUserFile) << c.name;
  }
}

class VolumeOs : public testing::FakeOs {
 public:
  std::map<std::string, std::string, std::less<>> files;
  int mountResult = 0;
  std::vector<std::string> calls;
  uint32_t mountFlags = 0;
  os::VolumeMountArguments mountArguments;

  int ReadFile(const char* path, size_t maxLength, std::vector<uint8_t>& contents) override {
    const auto found = files.find(path);
    if (found == files.end()) return -ENOENT;
    contents.assign(found->second.begin(), found->second.begin() + std::min(maxLength, found->second.size()));
    return 0;
  }
  int MountVolume(const char* type, const char* mountPoint, uint32_t flags,
                  const os::VolumeMountArguments& arguments) override {
    calls.push_back(std::string("mount ") + type + " " + arguments.devicePath + " " + mountPoint);
    mountFlags = flags;
    mountArguments = arguments;
    return mountResult;
  }
  int Unmount(const char* path, bool force) override {
    calls.push_back(std::string(force ? "force-unmount " : "unmount ") + path);
    return 0;
  }
  int OpenDevice(const char* path) override {
    calls.push_back(std::string("open ") + path);
    return ::dup(STDIN_FILENO);
  }
  int EjectDevice(int) override {
    calls.push_back("eject");
    return 0;
  }
};

std::string VersionPlist(const std::string& version) {
  return "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict><key>ProductVersion</key><string>" + version +
         "</string></dict></plist>";
}

class VolumeMountTest : public ::testing::Test {
 protected:
  VolumeMountTest() : services_(Services{nullptr, &os, nullptr, nullptr}) {
    os.files[std::string(kSystemVersionPath)] = VersionPlist("21.4.5");
  }
  void SetImageVersion(const std::string& mountPath, const std::string& version) {
    os.files[mountPath + std::string(kSystemVersionPath)] = VersionPlist(version);
  }
  VolumeOs os;
  log::CaptureSink capture;

 private:
  ScopedServices services_;
};

TEST_F(VolumeMountTest, VersionComparison) {
  const std::string noVersion = "<plist version=\"1.0\"><dict/></plist>";
  struct Case {
    const char* image;  // nullptr: no version file on the image
    bool matches;
    std::vector<std::string> lines;
  } cases[] = {
      {"21.4.1", true, {"Disk Image Product Version: 21.4", "System Product Version: 21.4"}},
      {"21.4", true, {"Disk Image Product Version: 21.4", "System Product Version: 21.4"}},
      {"21.04", false,
       {"Disk Image Product Version: 21.04", "System Product Version: 21.4",
        "System Version Mismatch for /Developer: (System: 21.4 / Image: 21.04)"}},
      {"22.4.5", false,
       {"Disk Image Product Version: 22.4", "System Product Version: 21.4",
        "System Version Mismatch for /Developer: (System: 21.4 / Image: 22.4)"}},
      {"21", false,
       {"Failed to retrieve disk image product version from /System/Library/Basalt/SystemVersion.plist."}},
      {nullptr, false,
       {"Failed to retrieve disk image product version from /System/Library/Basalt/SystemVersion.plist."}},
  };
  for (const Case& c : cases) {
    capture.Clear();
    os.files.erase("/Developer" + std::string(kSystemVersionPath));
    if (c.image) SetImageVersion("/Developer", c.image);
    EXPECT_EQ(VerifySystemVersion("/Developer"), c.matches) << (c.image ? c.image : "none");
    EXPECT_EQ(capture.Texts(), c.lines) << (c.image ? c.image : "none");
  }
  // The running system's own file is checked the same way.
  SetImageVersion("/Developer", "21.4");
  os.files[std::string(kSystemVersionPath)] = noVersion;
  capture.Clear();
  EXPECT_FALSE(VerifySystemVersion("/Developer"));
  EXPECT_EQ(capture.Texts().back(),
            "Failed to retrieve system product version from /System/Library/Basalt/SystemVersion.plist.");
}

TEST_F(VolumeMountTest, MountsReadOnlyWithTheBlockEncodingAndChecksTheVersion) {
  os.volumeHeaders["/dev/loop3"] = std::vector<uint8_t>(1024);
  const auto block = MasterDirectoryBlock("BD", "H+", {'e', 'n', 'c', 1});
  os.volumeHeaders["/dev/loop3"].insert(os.volumeHeaders["/dev/loop3"].end(), block.begin(), block.end());
  SetImageVersion("/Developer", "21.4.1");
  EXPECT_EQ(MountImageVolume("loop3", "/Developer"), "/dev/loop3");
  EXPECT_THAT(os.calls, ElementsAre("mount hfs /dev/loop3 /Developer"));
  EXPECT_EQ(os.mountFlags, os::kMountReadOnly);
  EXPECT_EQ(os.mountArguments.textEncoding, 1u);
  EXPECT_EQ(os.mountArguments.permissionMask, 0777);
  EXPECT_EQ(os.mountArguments.ownerUid + os.mountArguments.ownerGid, 0u);

  // "/" is mounted as a union; personalized roots are not version-checked; an
  // unreadable block leaves the encoding unchosen.
  os.calls.clear();
  SetImageVersion("/", "21.4");  // read as "//System/...": the paths are joined as they are
  EXPECT_EQ(MountImageVolume("loop4", "/"), "/dev/loop4");
  EXPECT_EQ(os.mountFlags, os::kMountReadOnly | os::kMountUnion);
  EXPECT_EQ(os.mountArguments.textEncoding, kNoTextEncoding);
  capture.Clear();
  EXPECT_EQ(MountImageVolume("loop4", "/private/var/personalized_debug"), "/dev/loop4");
  EXPECT_TRUE(capture.Texts().empty());
}

TEST_F(VolumeMountTest, FailuresLeaveTheirLineAndUndoOnlyAVersionMismatch) {
  EXPECT_EQ(MountImageVolume("", "/Developer"), std::nullopt);
  EXPECT_EQ(MountImageVolume(std::string(1100, 'a'), "/Developer"), std::nullopt);
  os.mountResult = -EINVAL;
  EXPECT_EQ(MountImageVolume("loop3", "/Developer"), std::nullopt);
  EXPECT_THAT(capture.Texts(), ElementsAre("Invalid inputs.", "Failed to create string.",
                                           "Failed to mount /dev/loop3 on /Developer: 22"));
  EXPECT_THAT(os.calls, ElementsAre("mount hfs /dev/loop3 /Developer"));  // left attached

  os.mountResult = 0;
  os.calls.clear();
  SetImageVersion("/Developer", "21.3");
  capture.Clear();
  EXPECT_EQ(MountImageVolume("loop3", "/Developer"), std::nullopt);
  EXPECT_EQ(capture.Texts().back(), "System version verification failed for /Developer.");
  EXPECT_THAT(os.calls, ElementsAre("mount hfs /dev/loop3 /Developer", "force-unmount /Developer",
                                    "open /dev/loop3", "eject"));
}

}  // namespace
}  // namespace brisvale
