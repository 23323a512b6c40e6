#include "media/fs_identify.h"

#include <algorithm>
#include <array>

#include "base/log.h"

namespace brisvale {
namespace {

constexpr size_t kOemNameOffset = 3;
constexpr std::array<uint8_t, 8> kNtfsOemName = {'N', 'T', 'F', 'S', ' ', ' ', ' ', ' '};
constexpr std::array<uint8_t, 8> kExFatOemName = {'E', 'X', 'F', 'A', 'T', ' ', ' ', ' '};

constexpr size_t kHfsSignatureOffset = 1024;
// Low byte of the big-endian version that follows the signature; the high byte is not
// looked at.
constexpr size_t kHfsVersionLowByteOffset = 1027;
constexpr uint8_t kHfsPlusVersion = 4;
constexpr uint8_t kHfsxVersion = 5;

// A long jump, or a short jump followed by a no-op.
bool IsBootSector(std::span<const uint8_t, kVolumeHeaderLength> header) {
  return header[0] == 0xE9 || (header[0] == 0xEB && header[2] == 0x90);
}

bool HasOemName(std::span<const uint8_t, kVolumeHeaderLength> header, const std::array<uint8_t, 8>& name) {
  return std::equal(name.begin(), name.end(), header.begin() + kOemNameOffset);
}

}  // namespace

const char* FsTypeLabel(FsType type) {
  switch (type) {
    case FsTypeFAT: return "MSDOS FAT";
    case FsTypeHFSPlus: return "HFS+";
    case FsTypeHFSX: return "HFSX";
    case FsTypeExFAT: return "MSDOS EXFAT";
    case FsTypeNTFS: return "MSDOS_NTFS";
    case FsTypeUnknown: break;
  }
  return "Unknown";
}

FsType ClassifyVolumeHeader(std::span<const uint8_t, kVolumeHeaderLength> header) {
  // A boot sector is never looked at for an HFS signature, even if it carries one.
  if (IsBootSector(header)) {
    if (HasOemName(header, kNtfsOemName)) return FsTypeNTFS;
    if (HasOemName(header, kExFatOemName)) return FsTypeExFAT;
    return FsTypeFAT;
  }
  const uint8_t first = header[kHfsSignatureOffset];
  const uint8_t second = header[kHfsSignatureOffset + 1];
  const uint8_t version = header[kHfsVersionLowByteOffset];
  if (first == 'H' && second == '+') return version == kHfsPlusVersion ? FsTypeHFSPlus : FsTypeUnknown;
  if (first == 'H' && second == 'X') return version == kHfsxVersion ? FsTypeHFSX : FsTypeUnknown;
  return FsTypeUnknown;
}

FsType IdentifyFilesystem(const char* devicePath, const VolumeHeaderReader& readHeader) {
  std::array<uint8_t, kVolumeHeaderLength> header{};
  const VolumeHeaderRead read = readHeader(devicePath, header);
  switch (read.outcome) {
    case VolumeHeaderRead::Outcome::OpenFailed:
      Log(Level::Default, "Failed to open %s: %{errno}d", devicePath, read.error);
      return FsTypeUnknown;
    case VolumeHeaderRead::Outcome::ReadFailed:
      Log(Level::Default, "Failed to read %s volume header: %{errno}d", devicePath, read.error);
      return FsTypeUnknown;
    case VolumeHeaderRead::Outcome::Read:
      break;
  }
  return ClassifyVolumeHeader(header);
}

}  // namespace brisvale
