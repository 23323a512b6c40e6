#include "media/fs_identify.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include "base/log.h"
#include "platform/linux/os_volume_header.h"

namespace brisvale {
namespace {

using Header = std::array<uint8_t, kVolumeHeaderLength>;

struct Patch {
  size_t offset;
  std::vector<uint8_t> bytes;
};

Patch Text(size_t offset, const char* text) {
  return {offset, std::vector<uint8_t>(text, text + std::strlen(text))};
}

struct HeaderCase {
  const char* why;
  std::vector<Patch> patches;  // applied to a zeroed header
  FsType expected;
};

void PrintTo(const HeaderCase& c, std::ostream* out) { *out << c.why; }

const Patch kShortJump = {0, {0xEB, 0x3C, 0x90}};
const Patch kLongJump = {0, {0xE9, 0x00, 0x00}};
const Patch kHfsPlus = {1024, {'H', '+', 0x00, 0x04}};
const Patch kHfsx = {1024, {'H', 'X', 0x00, 0x05}};

class Classify : public testing::TestWithParam<HeaderCase> {};

TEST_P(Classify, FromHeaderBytes) {
  Header header{};
  for (const Patch& patch : GetParam().patches) {
    std::copy(patch.bytes.begin(), patch.bytes.end(), header.begin() + patch.offset);
  }
  EXPECT_EQ(ClassifyVolumeHeader(header), GetParam().expected);
}

INSTANTIATE_TEST_SUITE_P(
    Cases, Classify,
    testing::Values(
        HeaderCase{"all zeros", {}, FsTypeUnknown},
        HeaderCase{"short jump, FAT OEM name", {kShortJump, Text(3, "MSDOS5.0")}, FsTypeFAT},
        HeaderCase{"long jump, any byte 2", {{0, {0xE9, 0x11, 0x22}}}, FsTypeFAT},
        HeaderCase{"eight blanks are FAT", {kShortJump, Text(3, "        ")}, FsTypeFAT},
        HeaderCase{"NTFS", {kShortJump, Text(3, "NTFS    ")}, FsTypeNTFS},
        HeaderCase{"NTFS after a long jump", {kLongJump, Text(3, "NTFS    ")}, FsTypeNTFS},
        HeaderCase{"exFAT", {kShortJump, Text(3, "EXFAT   ")}, FsTypeExFAT},
        HeaderCase{"NTFS, last blank missing", {kShortJump, Text(3, "NTFS   X")}, FsTypeFAT},
        HeaderCase{"NTFS in lower case", {kShortJump, Text(3, "ntfs    ")}, FsTypeFAT},
        HeaderCase{"exFAT, last blank missing", {kShortJump, Text(3, "EXFAT  X")}, FsTypeFAT},
        HeaderCase{"exFAT one byte early", {kLongJump, Text(2, "EXFAT   ")}, FsTypeFAT},
        HeaderCase{"HFS+", {kHfsPlus}, FsTypeHFSPlus},
        HeaderCase{"HFS+ ignores the version's high byte", {kHfsPlus, {1026, {0x12}}}, FsTypeHFSPlus},
        HeaderCase{"HFSX", {kHfsx}, FsTypeHFSX},
        HeaderCase{"HFS+ signature with HFSX version", {kHfsPlus, {1027, {5}}}, FsTypeUnknown},
        HeaderCase{"HFSX signature with HFS+ version", {kHfsx, {1027, {4}}}, FsTypeUnknown},
        HeaderCase{"HFS+ version 3", {kHfsPlus, {1027, {3}}}, FsTypeUnknown},
        HeaderCase{"lower-case h+", {kHfsPlus, Text(1024, "h+")}, FsTypeUnknown},
        HeaderCase{"H+ one byte late", {Text(1025, "H+"), {1028, {4}}}, FsTypeUnknown},
        HeaderCase{"plain HFS signature BD", {Text(1024, "BD")}, FsTypeUnknown},
        HeaderCase{"short jump without no-op leaves HFS to decide", {{0, {0xEB, 0x3C, 0x91}}, kHfsPlus},
                   FsTypeHFSPlus},
        HeaderCase{"short jump without no-op, NTFS name ignored",
                   {{0, {0xEB, 0x3C, 0x00}}, Text(3, "NTFS    ")}, FsTypeUnknown},
        HeaderCase{"jump byte one off", {{0, {0xEA, 0x3C, 0x90}}, Text(3, "NTFS    ")}, FsTypeUnknown},
        HeaderCase{"boot sector wins over HFS+", {kShortJump, Text(3, "MSDOS5.0"), kHfsPlus}, FsTypeFAT},
        HeaderCase{"exFAT wins over HFSX", {kShortJump, Text(3, "EXFAT   "), kHfsx}, FsTypeExFAT}));

TEST(FsTypeLabel, NamesEveryCode) {
  const std::vector<std::pair<uint32_t, std::string>> labels = {
      {0, "Unknown"}, {1, "MSDOS FAT"},   {2, "HFS+"},       {3, "HFSX"},
      {4, "MSDOS EXFAT"}, {5, "MSDOS_NTFS"}, {6, "Unknown"}};
  for (const auto& [code, label] : labels) EXPECT_EQ(FsTypeLabel(static_cast<FsType>(code)), label);
}

TEST(IdentifyFilesystem, ReaderFailuresLogAndGiveUnknown) {
  struct Case {
    VolumeHeaderRead::Outcome outcome;
    int error;
    std::string line;
  };
  const Case cases[] = {
      {VolumeHeaderRead::Outcome::OpenFailed, ENOENT, "Failed to open /dev/sdz: 2"},
      {VolumeHeaderRead::Outcome::ReadFailed, EIO, "Failed to read /dev/sdz volume header: 5"},
  };
  for (const Case& c : cases) {
    log::CaptureSink capture;
    // The reader writes a boot sector before failing: a failure must never classify it.
    const auto reader = [&](const char*, VolumeHeaderSpan header) {
      header[0] = 0xE9;
      return VolumeHeaderRead{c.outcome, c.error};
    };
    EXPECT_EQ(IdentifyFilesystem("/dev/sdz", reader), FsTypeUnknown);
    EXPECT_EQ(capture.Lines(), (std::vector<log::Line>{{Level::Default, c.line}}));
  }
}

// The real reader over plain files standing in for device nodes.
class RealDevice : public testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/fsid-test-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    dir_ = pattern;
  }
  void TearDown() override {
    for (const std::string& path : written_) ::unlink(path.c_str());
    ::rmdir(dir_.c_str());
  }
  std::string Write(const char* name, std::vector<uint8_t> bytes) {
    const std::string path = dir_ + "/" + name;
    std::ofstream(path, std::ios::binary).write(reinterpret_cast<const char*>(bytes.data()), bytes.size());
    written_.push_back(path);
    return path;
  }
  static std::vector<uint8_t> NtfsBootSector(size_t length) {
    std::vector<uint8_t> bytes(length);
    const uint8_t start[] = {0xEB, 0x52, 0x90, 'N', 'T', 'F', 'S', ' ', ' ', ' ', ' '};
    std::copy(std::begin(start), std::end(start), bytes.begin());
    return bytes;
  }

  std::string dir_;
  std::vector<std::string> written_;
};

TEST_F(RealDevice, WholeHeaderIsClassified) {
  const std::string path = Write("whole", NtfsBootSector(8192));
  log::CaptureSink capture;
  EXPECT_EQ(IdentifyFilesystem(path.c_str(), os::ReadVolumeHeader), FsTypeNTFS);
  EXPECT_TRUE(capture.Lines().empty());
}

TEST_F(RealDevice, ShortNodeFailsEvenWithABootSector) {
  const std::string path = Write("short", NtfsBootSector(4095));
  log::CaptureSink capture;
  EXPECT_EQ(IdentifyFilesystem(path.c_str(), os::ReadVolumeHeader), FsTypeUnknown);
  ASSERT_EQ(capture.Lines().size(), 1u);
  EXPECT_TRUE(capture.Lines()[0].text.starts_with("Failed to read " + path + " volume header: "));
}

TEST_F(RealDevice, MissingNodeReportsOpenError) {
  const std::string path = dir_ + "/absent";
  log::CaptureSink capture;
  EXPECT_EQ(IdentifyFilesystem(path.c_str(), os::ReadVolumeHeader), FsTypeUnknown);
  EXPECT_EQ(capture.Texts(), std::vector<std::string>{"Failed to open " + path + ": 2"});
}

TEST_F(RealDevice, DirectoryReportsReadError) {
  log::CaptureSink capture;
  EXPECT_EQ(IdentifyFilesystem(dir_.c_str(), os::ReadVolumeHeader), FsTypeUnknown);
  EXPECT_EQ(capture.Texts(), std::vector<std::string>{"Failed to read " + dir_ + " volume header: 21"});
}

}  // namespace
}  // namespace brisvale
