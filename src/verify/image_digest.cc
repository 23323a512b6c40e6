#include "verify/image_digest.h"

#include <cerrno>
#include <memory>
#include <new>

#include "base/log.h"
#include "base/unique_fd.h"
#include "platform/crypto.h"
#include "platform/os.h"
#include "platform/services.h"

namespace brisvale::verify {
namespace {

// Reads from offset 0 whatever the descriptor's position, so the caller's own
// descriptor can be digested as it is.
std::optional<plist::Bytes> DigestDescriptor(int fd, const std::string& pathText,
                                             crypto::DigestAlgorithm algorithm) {
  os::Os& os = *CurrentServices().os;
  crypto::Hasher hasher(algorithm);
  std::unique_ptr<uint8_t[]> buffer(new (std::nothrow) uint8_t[kDigestReadSize]);
  if (!buffer) {
    Log(Level::Default, "Failed to allocate memory: %{errno}d", ENOMEM);
    return std::nullopt;
  }
  for (uint64_t offset = 0;;) {
    const int64_t count = os.Read(fd, {buffer.get(), kDigestReadSize}, offset);
    if (count < 0) {
      Log(Level::Default, "Failed to read %@: %{errno}d", pathText, static_cast<int>(-count));
      return std::nullopt;
    }
    if (count == 0) break;
    offset += static_cast<uint64_t>(count);
    if (!hasher.Update({buffer.get(), static_cast<size_t>(count)})) break;
  }
  plist::Bytes digest(crypto::DigestLength(algorithm));
  if (!hasher.Finish(digest)) {
    Log(Level::Default, "Failed to compute the digest of %@.", pathText);
    return std::nullopt;
  }
  return digest;
}

std::optional<plist::Bytes> DigestFile(std::string_view path, crypto::DigestAlgorithm algorithm) {
  if (path.empty()) {
    Log(Level::Default, "Invalid input.");
    return std::nullopt;
  }
  std::string pathText(path);
  const UniqueFd file(CurrentServices().os->OpenFile(pathText.c_str()));
  if (!file) {
    Log(Level::Default, "Failed to create file handle for %@.", pathText);
    return std::nullopt;
  }
  return DigestDescriptor(file.get(), pathText, algorithm);
}

std::optional<crypto::DigestAlgorithm> AlgorithmForLength(long length) {
  if (length == static_cast<long>(crypto::kSha384Length)) return crypto::DigestAlgorithm::Sha384;
  if (length == static_cast<long>(crypto::kSha1Length)) return crypto::DigestAlgorithm::Sha1;
  Log(Level::Default, "Unsupported digest size: %ld", length);
  return std::nullopt;
}

}  // namespace

std::optional<plist::Bytes> DigestFileSha1(std::string_view path) {
  return DigestFile(path, crypto::DigestAlgorithm::Sha1);
}

std::optional<plist::Bytes> DigestFileSha384(std::string_view path) {
  return DigestFile(path, crypto::DigestAlgorithm::Sha384);
}

int DigestImageFile(std::string_view path, std::vector<uint8_t>* digest, long length) {
  if (!digest) {
    Log(Level::Default, "Invalid input");
    return -1;
  }
  const std::optional<crypto::DigestAlgorithm> algorithm = AlgorithmForLength(length);
  std::optional<plist::Bytes> computed;
  if (algorithm) computed = DigestFile(path, *algorithm);
  if (!computed) {
    Log(Level::Default, "Failed to digest data.");
    return -1;
  }
  *digest = std::move(*computed);
  return 0;
}

int DigestImageDescriptor(int fd, std::string_view path, std::vector<uint8_t>* digest, long length) {
  if (!digest || fd < 0) {
    Log(Level::Default, "Invalid input");
    return -1;
  }
  const std::optional<crypto::DigestAlgorithm> algorithm = AlgorithmForLength(length);
  std::optional<plist::Bytes> computed;
  if (algorithm) computed = DigestDescriptor(fd, std::string(path), *algorithm);
  if (!computed) {
    Log(Level::Default, "Failed to digest data.");
    return -1;
  }
  *digest = std::move(*computed);
  return 0;
}

}  // namespace brisvale::verify
