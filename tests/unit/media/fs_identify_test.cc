// File-system identification from a volume header (media/fs_identify).
#include "media/fs_identify.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstring>

#include "base/log.h"
#include "platform/linux/os_system.h"
#include "test_files.h"

namespace brisvale {
namespace {

TEST(IdentifyFilesystem, ClassifiesHeaderBytes) {
  struct Patch {
    size_t offset;
    std::string bytes;
  };
  const Patch kShortJump = {0, "\xEB\x3C\x90"}, kLongJump = {0, "\xE9"};
  const Patch kHfsPlus = {1024, std::string("H+\0\x04", 4)}, kHfsx = {1024, std::string("HX\0\x05", 4)};
  struct Case {
    const char* why;
    std::vector<Patch> patches;  // written over a zeroed header
    FsType expected;
  };
  const Case cases[] = {
      {"short jump, FAT OEM name", {kShortJump, {3, "MSDOS5.0"}}, FsTypeFAT},
      {"long jump, any byte 2", {{0, "\xE9\x11\x22"}}, FsTypeFAT},
      {"NTFS", {kShortJump, {3, "NTFS    "}}, FsTypeNTFS},
      {"exFAT after a long jump", {kLongJump, {3, "EXFAT   "}}, FsTypeExFAT},
      {"NTFS, last blank off", {kShortJump, {3, "NTFS   X"}}, FsTypeFAT},
      {"HFS+", {kHfsPlus}, FsTypeHFSPlus},
      {"HFS+ ignores the version's high byte", {kHfsPlus, {1026, "\x12"}}, FsTypeHFSPlus},
      {"HFSX", {kHfsx}, FsTypeHFSX},
      {"HFS+ signature with HFSX version", {kHfsPlus, {1027, "\x05"}}, FsTypeUnknown},
      {"short jump without no-op leaves HFS to decide", {{0, "\xEB\x3C\x91"}, kHfsPlus}, FsTypeHFSPlus},
      {"jump byte one off", {{0, "\xEA\x3C\x90NTFS    "}}, FsTypeUnknown},
      {"boot sector wins over HFS+", {kShortJump, {3, "MSDOS5.0"}, kHfsPlus}, FsTypeFAT},
  };
  for (const Case& c : cases) {
    std::array<uint8_t, kVolumeHeaderLength> header{};
    for (const Patch& patch : c.patches) std::memcpy(&header[patch.offset], patch.bytes.data(), patch.bytes.size());
    EXPECT_EQ(ClassifyVolumeHeader(header), c.expected) << c.why;
  }
}

// The POSIX reader over plain files standing in for device nodes: a failed open or read
// logs and gives no type, even after part of a boot sector was read; a FIFO where the
// node should be must not block.
TEST(IdentifyFilesystem, RealNodesNeedAWholeHeader) {
  brisvale::testing::ScratchDir dir;
  const std::string whole = (dir / "whole").string(), shortNode = (dir / "short").string(), fifo = (dir / "fifo").string();
  std::string bytes = std::string("\xEB\x52\x90NTFS    ") + std::string(8192, '\0');
  brisvale::testing::WriteFileBytes(whole, std::vector<uint8_t>(bytes.begin(), bytes.end()));
  brisvale::testing::WriteFileBytes(shortNode, std::vector<uint8_t>(bytes.begin(), bytes.begin() + kVolumeHeaderLength - 1));
  ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);

  log::CaptureSink capture;
  os::LinuxOs linuxOs;
  const VolumeHeaderReader readHeader = [&](const char* path, VolumeHeaderSpan header) {
    return linuxOs.ReadVolumeHeader(path, header);
  };
  EXPECT_EQ(IdentifyFilesystem(whole.c_str(), readHeader), FsTypeNTFS);
  const std::pair<std::string, std::string> unknown[] = {
      {shortNode, "Failed to read " + shortNode + " volume header: 0"},  // a short read sets no error
      {fifo, "Failed to read " + fifo + " volume header: 29"},
      {dir.str() + "/missing", "Failed to open " + dir.str() + "/missing: 2"},
  };
  for (const auto& [path, line] : unknown) {
    capture.Clear();
    EXPECT_EQ(IdentifyFilesystem(path.c_str(), readHeader), FsTypeUnknown);
    EXPECT_EQ(capture.Lines(), (std::vector<log::Line>{{Level::Default, line}}));
  }
}

}  // namespace
}  // namespace brisvale
