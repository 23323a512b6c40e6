// Digests of disk image files: SHA-1 for developer and factory images, SHA-1 or SHA-384
// for personalized ones as their manifest asks. Files are streamed through one buffer of
// constant size, so memory use does not grow with the image.
#pragma once

#include <cstdint>
#include <optional>
#include <string_view>
#include <vector>

#include "base/plist.h"

namespace brisvale::verify {

// Bytes read per round: large enough that hashing, not system calls, sets the pace.
inline constexpr size_t kDigestReadSize = 1 << 20;

// Digests the file with SHA-1 (length 20) or SHA-384 (length 48) into `digest`.
// 0 on success; -1 after logging why.
int DigestImageFile(std::string_view path, std::vector<uint8_t>* digest, long length);

// The same for a file already open for reading, read from its start; `path` only names
// it in log lines.
int DigestImageDescriptor(int fd, std::string_view path, std::vector<uint8_t>* digest, long length);

// The 20-byte SHA-1 or 48-byte SHA-384 of the file's contents, or none after logging why.
std::optional<plist::Bytes> DigestFileSha1(std::string_view path);
std::optional<plist::Bytes> DigestFileSha384(std::string_view path);

}  // namespace brisvale::verify
