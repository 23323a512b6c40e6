// Message digests over OpenSSL's EVP interface.
#include <openssl/evp.h>

#include "platform/crypto.h"
#include "platform/linux/openssl_handles.h"

namespace brisvale::crypto {

using openssl::MessageDigest;

bool Digest(DigestAlgorithm algorithm, std::span<const uint8_t> input, std::span<uint8_t> out) {
  const size_t length = DigestLength(algorithm);
  if (out.size() < length) return false;
  unsigned int written = 0;
  if (EVP_Digest(input.data(), input.size(), out.data(), &written, MessageDigest(algorithm), nullptr) != 1) {
    return false;
  }
  return written == length;
}

struct Hasher::State {
  openssl::MdCtxPtr context;
  bool failed = false;
};

Hasher::Hasher(DigestAlgorithm algorithm) : algorithm_(algorithm), state_(new State) {
  state_->context.reset(EVP_MD_CTX_new());
  state_->failed = state_->context == nullptr ||
                   EVP_DigestInit_ex(state_->context.get(), MessageDigest(algorithm), nullptr) != 1;
}

Hasher::~Hasher() = default;

bool Hasher::Update(std::span<const uint8_t> input) {
  if (state_->failed) return false;
  if (EVP_DigestUpdate(state_->context.get(), input.data(), input.size()) != 1) {
    state_->failed = true;
  }
  return !state_->failed;
}

bool Hasher::Finish(std::span<uint8_t> out) {
  const size_t length = DigestLength(algorithm_);
  if (state_->failed || out.size() < length) {
    state_->failed = true;
    return false;
  }
  unsigned int written = 0;
  // Finishing ends the context; any later step must fail.
  const bool finished = EVP_DigestFinal_ex(state_->context.get(), out.data(), &written) == 1;
  state_->failed = true;
  return finished && written == length;
}

}  // namespace brisvale::crypto
