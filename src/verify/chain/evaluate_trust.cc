// The fixed SHA-1 entry of the container's trust evaluation, bound to the general
// root's chain and RSA signatures.
#include "verify/chain/secure_boot.h"

namespace brisvale {

int qor4_verify_signature_with_chain(const uint8_t* chain, uint32_t chainLength,
                                     const uint8_t* signature, uint32_t signatureLength,
                                     const uint8_t* digest, uint32_t digestLength,
                                     const uint8_t** certificateProperties,
                                     uint32_t* certificatePropertiesLength) {
  const Qor4SecureBootParams* params = &kQor4DecodeSecureBootRsa1kSha1;
  const uint8_t* publicKey = nullptr;
  uint32_t publicKeyLength = 0;
  if (verify_chain_qor4_v1(chain, chainLength, &publicKey, &publicKeyLength,
                           certificateProperties, certificatePropertiesLength, params,
                           nullptr) != 0) {
    return -1;
  }
  return verify_signature_rsa(publicKey, publicKeyLength, signature, signatureLength, digest,
                              digestLength, params, nullptr);
}

int Qor4DecodeEvaluateTrust(uint32_t objectCode, Qor4DecodeContext* context,
                            Qor4PropertyCallback propertyCallback, void* callbackContext) {
  return Qor4DecodeEvaluateTrustWithCallbacks(objectCode, context, propertyCallback,
                                              qor4_verify_signature_with_chain,
                                              Qor4DecodeEvaluateCertificateProperties,
                                              sha1_digest, callbackContext);
}

}  // namespace brisvale
