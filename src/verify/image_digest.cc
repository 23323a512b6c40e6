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

std::optional<plist::Bytes> DigestFile(std::string_view path, crypto::DigestAlgorithm algorithm) {
  if (path.empty()) {
    Log(Level::Default, "Invalid input.");
    return std::nullopt;
  }
  os::Os& os = *CurrentServices().os;
  std::string pathText(path);
  const UniqueFd file(os.OpenFile(pathText.c_str()));
  if (!file) {
    Log(Level::Default, "Failed to create file handle for %@.", pathText);
    return std::nullopt;
  }

  crypto::Hasher hasher(algorithm);
  std::unique_ptr<uint8_t[]> buffer(new (std::nothrow) uint8_t[kDigestReadSize]);
  if (!buffer) {
    Log(Level::Default, "Failed to allocate memory: %{errno}d", ENOMEM);
    return std::nullopt;
  }
  for (;;) {
    const int64_t count = os.Read(file.get(), {buffer.get(), kDigestReadSize});
    if (count < 0) {
      Log(Level::Default, "Failed to read %@: %{errno}d", pathText, static_cast<int>(-count));
      return std::nullopt;
    }
    if (count == 0) break;
    if (!hasher.Update({buffer.get(), static_cast<size_t>(count)})) break;
  }
  plist::Bytes digest(crypto::DigestLength(algorithm));
  if (!hasher.Finish(digest)) {
    Log(Level::Default, "Failed to compute the digest of %@.", pathText);
    return std::nullopt;
  }
  return digest;
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
  std::optional<plist::Bytes> computed;
  if (length == static_cast<long>(crypto::kSha384Length)) {
    computed = DigestFileSha384(path);
  } else if (length == static_cast<long>(crypto::kSha1Length)) {
    computed = DigestFileSha1(path);
  } else {
    Log(Level::Default, "Unsupported digest size: %ld", length);
  }
  if (!computed) {
    Log(Level::Default, "Failed to digest data.");
    return -1;
  }
  *digest = std::move(*computed);
  return 0;
}

}  // namespace brisvale::verify
