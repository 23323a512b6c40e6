// File-system identification from a volume header (media/fs_identify).
#include "media/fs_identify.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>

#include "base/log.h"
#include "platform/linux/os_system.h"

namespace brisvale {
namespace {

struct Patch {
  size_t offset;
  std::string bytes;
};
struct HeaderCase {
  const char* why;
  std::vector<Patch> patches;  // written over a zeroed header
  FsType expected;
};
void PrintTo(const HeaderCase& c, std::ostream* out) { *out << c.why; }

const Patch kShortJump = {0, "\xEB\x3C\x90"};
const Patch kLongJump = {0, "\xE9"};
const Patch kHfsPlus = {1024, std::string("H+\0\x04", 4)};
const Patch kHfsx = {1024, std::string("HX\0\x05", 4)};

class Classify : public testing::TestWithParam<HeaderCase> {};

TEST_P(Classify, FromHeaderBytes) {
  std::array<uint8_t, kVolumeHeaderLength> header{};
  for (const Patch& patch : GetParam().patches) std::memcpy(&header[patch.offset], patch.bytes.data(), patch.bytes.size());
  EXPECT_EQ(ClassifyVolumeHeader(header), GetParam().expected);
}

INSTANTIATE_TEST_SUITE_P(
    Cases, Classify,
    testing::Values(
        HeaderCase{"all zeros", {}, FsTypeUnknown},
        HeaderCase{"short jump, FAT OEM name", {kShortJump, {3, "MSDOS5.0"}}, FsTypeFAT},
        HeaderCase{"long jump, any byte 2", {{0, "\xE9\x11\x22"}}, FsTypeFAT},
        HeaderCase{"eight blanks are FAT", {kShortJump, {3, "        "}}, FsTypeFAT},
        HeaderCase{"NTFS", {kShortJump, {3, "NTFS    "}}, FsTypeNTFS},
        HeaderCase{"exFAT after a long jump", {kLongJump, {3, "EXFAT   "}}, FsTypeExFAT},
        HeaderCase{"NTFS, last blank off", {kShortJump, {3, "NTFS   X"}}, FsTypeFAT},
        HeaderCase{"exFAT, last blank off", {kShortJump, {3, "EXFAT  X"}}, FsTypeFAT},
        HeaderCase{"exFAT one byte early", {kLongJump, {2, "EXFAT   "}}, FsTypeFAT},
        HeaderCase{"HFS+", {kHfsPlus}, FsTypeHFSPlus},
        HeaderCase{"HFS+ ignores the version's high byte", {kHfsPlus, {1026, "\x12"}}, FsTypeHFSPlus},
        HeaderCase{"HFSX", {kHfsx}, FsTypeHFSX},
        HeaderCase{"HFS+ signature with HFSX version", {kHfsPlus, {1027, "\x05"}}, FsTypeUnknown},
        HeaderCase{"HFSX signature with HFS+ version", {kHfsx, {1027, "\x04"}}, FsTypeUnknown},
        HeaderCase{"HFS+ signature one byte late", {{1025, "H+\0\x04"}}, FsTypeUnknown},
        HeaderCase{"short jump without no-op leaves HFS to decide", {{0, "\xEB\x3C\x91"}, kHfsPlus}, FsTypeHFSPlus},
        HeaderCase{"short jump without no-op ignores the OEM name", {{0, "\xEB\x3C\x00NTFS    "}}, FsTypeUnknown},
        HeaderCase{"jump byte one off", {{0, "\xEA\x3C\x90NTFS    "}}, FsTypeUnknown},
        HeaderCase{"boot sector wins over HFS+", {kShortJump, {3, "MSDOS5.0"}, kHfsPlus}, FsTypeFAT},
        HeaderCase{"exFAT wins over HFSX", {kShortJump, {3, "EXFAT   "}, kHfsx}, FsTypeExFAT}));

TEST(IdentifyFilesystem, ReaderFailuresLogAndGiveUnknown) {
  const std::tuple<VolumeHeaderRead::Outcome, int, std::string> cases[] = {
      {VolumeHeaderRead::Outcome::OpenFailed, ENOENT, "Failed to open /dev/sdz: 2"},
      {VolumeHeaderRead::Outcome::ReadFailed, EIO, "Failed to read /dev/sdz volume header: 5"},
  };
  for (const auto& [outcome, error, line] : cases) {
    log::CaptureSink capture;
    // A boot sector written before the failure must not be classified.
    const auto reader = [&](const char*, VolumeHeaderSpan header) {
      header[0] = 0xE9;
      return VolumeHeaderRead{outcome, error};
    };
    EXPECT_EQ(IdentifyFilesystem("/dev/sdz", reader), FsTypeUnknown);
    EXPECT_EQ(capture.Lines(), (std::vector<log::Line>{{Level::Default, line}}));
  }
}

// The POSIX reader over plain files standing in for device nodes.
TEST(IdentifyFilesystem, RealNodesNeedAWholeHeader) {
  char dir[] = "/tmp/fsid-test-XXXXXX";
  ASSERT_NE(::mkdtemp(dir), nullptr);
  const std::string whole = std::string(dir) + "/whole", shortNode = std::string(dir) + "/short";
  std::string bytes = std::string("\xEB\x52\x90NTFS    ") + std::string(8192, '\0');
  std::ofstream(whole, std::ios::binary) << bytes;
  std::ofstream(shortNode, std::ios::binary) << bytes.substr(0, kVolumeHeaderLength - 1);

  log::CaptureSink capture;
  os::LinuxOs linuxOs;
  const VolumeHeaderReader readHeader = [&](const char* path, VolumeHeaderSpan header) {
    return linuxOs.ReadVolumeHeader(path, header);
  };
  EXPECT_EQ(IdentifyFilesystem(whole.c_str(), readHeader), FsTypeNTFS);
  EXPECT_EQ(IdentifyFilesystem(shortNode.c_str(), readHeader), FsTypeUnknown);
  EXPECT_EQ(IdentifyFilesystem(dir, readHeader), FsTypeUnknown);
  ::unlink(whole.c_str()), ::unlink(shortNode.c_str()), ::rmdir(dir);
  EXPECT_EQ(IdentifyFilesystem(whole.c_str(), readHeader), FsTypeUnknown);
  const std::vector<std::string> expected = {
      "Failed to read " + shortNode + " volume header: 0",  // a short read sets no error
      "Failed to read " + std::string(dir) + " volume header: 21",
      "Failed to open " + whole + ": 2",
  };
  EXPECT_EQ(capture.Texts(), expected);
}

}  // namespace
}  // namespace brisvale
