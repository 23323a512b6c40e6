// X.509 path validation over OpenSSL 3 with caller-chosen anchors and a fixed instant.
// The anchors are the only trusted certificates: the system's store is never consulted,
// and an anchor is trusted as it is, whether or not it is self-signed.
#include <openssl/err.h>

#include "platform/linux/trust_impl.h"

namespace brisvale::certtrust {

struct Trust::State {
  std::vector<Certificate> certificates;
  std::vector<Certificate> anchors;
  std::optional<int64_t> verifyTime;
  std::optional<PublicKey> evaluatedKey;
};

Trust::Trust(std::unique_ptr<State> state) : state_(std::move(state)) {}
Trust::~Trust() = default;
Trust::Trust(Trust&&) noexcept = default;
Trust& Trust::operator=(Trust&&) noexcept = default;

std::optional<Trust> Trust::Create(const std::vector<Certificate>& certificates,
                                   const Policy& policy) {
  if (certificates.empty() || !policy.basicX509) return std::nullopt;
  auto state = std::make_unique<State>();
  state->certificates = certificates;
  return Trust(std::move(state));
}

bool Trust::SetAnchorCertificates(const std::vector<Certificate>& anchors) {
  state_->anchors = anchors;
  return true;
}

bool Trust::SetVerifyDate(int64_t unixTime) {
  state_->verifyTime = unixTime;
  return true;
}

bool Trust::Evaluate(TrustResult* result) {
  state_->evaluatedKey.reset();
  openssl::X509StorePtr store(X509_STORE_new());
  openssl::X509StackPtr untrusted(sk_X509_new_null());
  openssl::X509StoreCtxPtr ctx(X509_STORE_CTX_new());
  if (!result || !store || !untrusted || !ctx) return false;
  for (const Certificate& anchor : state_->anchors) {
    if (X509_STORE_add_cert(store.get(), anchor.impl().x509.get()) != 1) return false;
  }
  for (size_t i = 1; i < state_->certificates.size(); ++i) {
    X509* candidate = state_->certificates[i].impl().x509.get();
    if (X509_up_ref(candidate) != 1) return false;
    if (sk_X509_push(untrusted.get(), candidate) <= 0) {
      X509_free(candidate);
      return false;
    }
  }
  X509* subject = state_->certificates.front().impl().x509.get();
  if (X509_STORE_CTX_init(ctx.get(), store.get(), subject, untrusted.get()) != 1) {
    return false;
  }
  X509_VERIFY_PARAM* param = X509_STORE_CTX_get0_param(ctx.get());
  X509_VERIFY_PARAM_set_flags(param, X509_V_FLAG_PARTIAL_CHAIN);
  if (state_->verifyTime) X509_VERIFY_PARAM_set_time(param, *state_->verifyTime);

  int verified = X509_verify_cert(ctx.get());
  ERR_clear_error();
  if (verified < 0) return false;
  if (verified == 0) {
    *result = TrustResult::RecoverableFailure;
    return true;
  }
  EVP_PKEY* key = X509_get0_pubkey(subject);
  if (key && EVP_PKEY_up_ref(key) == 1) {
    auto impl = std::make_shared<PublicKey::Impl>();
    impl->key.reset(key);
    state_->evaluatedKey = PublicKey(std::move(impl));
  }
  *result = TrustResult::Unspecified;
  return true;
}

std::optional<PublicKey> Trust::CopyPublicKey() const { return state_->evaluatedKey; }

}  // namespace brisvale::certtrust
