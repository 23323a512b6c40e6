#include "diskimage/text_encoding.h"

#include <algorithm>
#include <array>
#include <cstdlib>

namespace brisvale {
namespace {

// HFS master directory block: read at byte 1024 of the device, big-endian fields.
constexpr size_t kMasterDirectoryBlockSize = 512;
constexpr size_t kSignatureOffset = 0;
constexpr size_t kEncodingHintOffset = 108;  // word 4 of the volume information at 92
constexpr size_t kEmbeddedSignatureOffset = 124;

// The accepted encoding identifiers, in the order they are searched.
constexpr std::array<uint32_t, 38> kHfsEncodings = {
    4,  24, 13, 19, 39, 29, 25, 2,  36, 7,  9,  28, 140, 40, 23, 6,  11, 10, 5,
    37, 1,  16, 20, 3,  22, 17, 27, 12, 0,  38, 18, 14,  15, 21, 26, 35, 152, 30};

bool HasSignature(std::span<const uint8_t> block, size_t offset, char first, char second) {
  return block[offset] == static_cast<uint8_t>(first) && block[offset + 1] == static_cast<uint8_t>(second);
}

}  // namespace

uint32_t ChooseTextEncoding(std::span<const uint8_t> masterDirectoryBlock,
                            const TextEncodingSources& sources) {
  // Only a whole block of an HFS wrapper around an HFS+ volume names an encoding.
  if (masterDirectoryBlock.size() < kMasterDirectoryBlockSize ||
      !HasSignature(masterDirectoryBlock, kSignatureOffset, 'B', 'D') ||
      !HasSignature(masterDirectoryBlock, kEmbeddedSignatureOffset, 'H', '+')) {
    return kNoTextEncoding;
  }
  const uint8_t* hint = masterDirectoryBlock.data() + kEncodingHintOffset;
  int64_t candidate = 0;
  if (hint[0] == 'e' && hint[1] == 'n' && hint[2] == 'c') {
    candidate = hint[3];
  } else if (const int32_t bias = sources.encodingBias ? sources.encodingBias() : -1;
             bias != 0 && bias != -1) {
    candidate = bias;
  } else if (const auto text = sources.userTextEncoding ? sources.userTextEncoding() : std::nullopt) {
    // The file starts with the encoding number, in any base strtol reads.
    candidate = std::strtol(text->c_str(), nullptr, 0);
  }
  const bool known = std::find(kHfsEncodings.begin(), kHfsEncodings.end(), candidate) != kHfsEncodings.end();
  return known ? static_cast<uint32_t>(candidate) : 0;
}

}  // namespace brisvale
