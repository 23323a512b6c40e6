// The text encoding an HFS-wrapped volume is mounted with: chosen from the volume's
// master directory block, else from the file system's bias, else from user 0's
// preference, and always one of the encodings HFS knows.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <span>
#include <string>

namespace brisvale {

// The text encoding value that means "none chosen".
inline constexpr uint32_t kNoTextEncoding = 0xFFFFFFFF;

// Where the encoding of an HFS-wrapped volume comes from when its master directory
// block gives no hint. Each source is asked only when the choice gets that far.
struct TextEncodingSources {
  // The HFS file system's encoding bias; -1 when it cannot be asked.
  std::function<int32_t()> encodingBias;
  // The contents of user 0's text-encoding file, none when it has none.
  std::function<std::optional<std::string>()> userTextEncoding;
};

// The text encoding to mount with, from the 512-byte master directory block read at
// byte 1024 of the device (shorter when the read fell short).
uint32_t ChooseTextEncoding(std::span<const uint8_t> masterDirectoryBlock,
                            const TextEncodingSources& sources);

}  // namespace brisvale
